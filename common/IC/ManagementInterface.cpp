#include <IC/ManagementInterface.h>

namespace IC {

// Out of line so that the class's vtable and type information live in this
// library and are shared by every plug-in.
ManagementInterface::~ManagementInterface() = default;

} // namespace IC

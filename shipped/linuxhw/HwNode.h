// HwNode: the plug-in's node, which knows the path the library gave it.
#pragma once

#include "KnownPathNode.h"

namespace linuxhw {

using HwNode = shipped::KnownPathNode;

} // namespace linuxhw

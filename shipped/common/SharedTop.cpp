#include "SharedTree.h"

#include <mutex>

namespace shipped {

namespace {

std::mutex topLock;
SharedTop top; // guarded by topLock

} // namespace

void announceTop(SharedTop const& reported)
{
    std::lock_guard<std::mutex> g(topLock);
    top = reported;
}

void withdrawTop(unsigned int rootId)
{
    std::lock_guard<std::mutex> g(topLock);
    if (top.rootId == rootId)
        top = SharedTop();
}

SharedTop sharedTop()
{
    std::lock_guard<std::mutex> g(topLock);
    return top;
}

} // namespace shipped

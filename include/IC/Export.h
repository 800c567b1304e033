// Export macro of the instrumentation control library. The library is built
// with hidden visibility; only what carries IC_API is part of its ABI.
#pragma once

#if defined(IC_BUILDING)
#define IC_API __attribute__((visibility("default")))
#else
#define IC_API
#endif

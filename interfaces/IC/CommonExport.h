// Export macro of the common libraries (iccommon). The library is built with
// hidden visibility; only what carries this macro is part of its ABI.
#pragma once

#if defined(ICCOMMON_BUILDING)
#define ICCOMMON_API __attribute__((visibility("default")))
#else
#define ICCOMMON_API
#endif

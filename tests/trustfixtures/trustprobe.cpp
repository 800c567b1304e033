// A stand-in plug-in for the trust tests. Its constructor appends its name to
// the file named by TRUST_MARKER, so that a test sees whether the loader ran
// any of its code. It is built several times under different names, and every
// build exports the same symbols.
#include <cstdio>
#include <cstdlib>

#include <dlfcn.h>

#ifndef TRUST_NAME
#error "TRUST_NAME must be set"
#endif

namespace {
struct Marker {
    Marker()
    {
        if (char const* path = std::getenv("TRUST_MARKER"))
            if (std::FILE* f = std::fopen(path, "a")) {
                std::fputs(TRUST_NAME "\n", f);
                std::fclose(f);
            }
    }
} marker;
} // namespace

#ifdef TRUST_UNRESOLVED
// Defined nowhere: loading with every symbol resolved must fail before the
// constructor above runs.
extern "C" int trust_fixture_missing_symbol();

extern "C" __attribute__((visibility("default"))) int trust_uses_missing()
{
    return trust_fixture_missing_symbol();
}
#endif

#ifdef TRUST_USES_DEP
extern "C" int trust_dep_value();

extern "C" __attribute__((visibility("default"))) int trust_through_dep()
{
    return trust_dep_value();
}
#endif

extern "C" {

__attribute__((visibility("default"), noinline)) char const* trust_name()
{
    return TRUST_NAME;
}

// Reaches trust_name the way any use of an exported name does, through the
// dynamic linker: were the builds loaded into one global scope, the first
// one's would answer for all.
__attribute__((visibility("default"))) char const* trust_whoami()
{
    return trust_name();
}

// The file this library is, as the loader names it to anyone who asks: what
// a plug-in uses to find its data files or name itself.
__attribute__((visibility("default"))) char const* trust_file()
{
    Dl_info info{};
    return dladdr(reinterpret_cast<void*>(&trust_file), &info) != 0 ? info.dli_fname : "";
}

} // extern "C"

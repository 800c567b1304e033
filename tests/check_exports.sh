#!/bin/sh
# Every dynamic symbol that the library defines belongs to its interface: the
# C entry points or a name in namespace IC. Anything else (a std:: template
# instantiation, a helper) is a leak.
lib="$1"
leaks=$(nm -D --defined-only "$lib" | awk '{print $3}' | c++filt |
  grep -v -E '^(IC::|typeinfo for IC::|typeinfo name for IC::|vtable for IC::|VTT for IC::|Open$|Openlib$|Openliblog$|Unloadlib$)' |
  grep -v -E '^(_init|_fini|_edata|_end|__bss_start)$' |
  grep -v -E '^(LIBINSTRUMENTATIONCONTROL|VERS_|[A-Za-z_]*_[0-9.]+)$' || true)
if [ -n "$leaks" ]; then
  echo "symbols exported that are not part of the interface:"
  echo "$leaks"
  exit 1
fi
echo "exports: only the interface"

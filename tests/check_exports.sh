#!/bin/sh
# Every dynamic symbol that the library defines belongs to its interface: the
# C entry points or a name in namespace IC, but not the globals kept inside
# (the facade object, the failure error, the loggers' names). Hosts may
# derive from the loader thread, so its type information is exported. Clients
# find the entry points by name.
lib="$1"
syms=$(nm -D --defined-only "$lib" | awk '{print $3}' | c++filt)
leaks=$(echo "$syms" |
  grep -v -E '^(IC::|typeinfo for IC::|typeinfo name for IC::|vtable for IC::|VTT for IC::|Open$|Openlib$|Openliblog$|Unloadlib$)' |
  grep -v -E '^(_init|_fini|_edata|_end|__bss_start)$' |
  grep -v -E '^(LIBINSTRUMENTATIONCONTROL|VERS_|[A-Za-z_]*_[0-9.]+)$' || true)
inside=$(echo "$syms" | grep -E '^IC::(InstCtrl::(loggerIC|ic|myice|lderr)|NODESTORE::(NSTS|loggerNodeStore))(\[|$)' || true)
missing=""
for s in Open Openlib Openliblog Unloadlib 'typeinfo for IC::LoaderThread' 'vtable for IC::LoaderThread' 'IC::InstCtrl::nodestore' \
         'IC::InstCtrl::donegood' 'IC::InstrumentationControl::getModuleVersion() const'; do
  echo "$syms" | grep -q -x -F "$s" || missing="$missing$s
"
done
if [ -n "$leaks$inside" ]; then
  echo "symbols exported that are not part of the interface:"
  echo "$leaks$inside"
  exit 1
fi
if [ -n "$missing" ]; then
  echo "interface symbols not exported:"
  echo "$missing"
  exit 1
fi
echo "exports: only the interface"

#!/usr/bin/env bash
# Builds the project and runs its tests: a normal build, a build with
# AddressSanitizer + UndefinedBehaviorSanitizer, and (with --tsan, or
# IC_TSAN=1) the tests again under ThreadSanitizer. Any sanitizer report fails
# the run. Installs the packages it needs first.
#
#   scripts/test.sh            normal + ASan/UBSan
#   scripts/test.sh --tsan     normal + ASan/UBSan + TSan
#   scripts/test.sh --quick    normal build only
#   scripts/test.sh --soak     also the long open/unload soak (10,000 cycles)
#   scripts/test.sh --i386     also the 32-bit x86 form (-m32, cmake/i386-linux-gnu.cmake)
set -euo pipefail
cd "$(dirname "$0")/.."

quick=0
soak=0
i386=0
tsan=${IC_TSAN:-0}
for arg in "$@"; do
  case "$arg" in
    --quick) quick=1 ;;
    --tsan) tsan=1 ;;
    --soak) soak=1 ;;
    --i386) i386=1 ;;
    *) echo "usage: $0 [--quick] [--tsan] [--soak] [--i386]" >&2; exit 2 ;;
  esac
done

if [[ $i386 -eq 1 ]]; then scripts/install-deps.sh --i386; else scripts/install-deps.sh; fi

jobs=$(nproc 2>/dev/null || echo 2)

# build_and_test NAME CTEST_ARGS... -- CMAKE_ARGS...
build_and_test() {
  local name=$1; shift
  local ctest_args=()
  while [[ $# -gt 0 && "$1" != "--" ]]; do ctest_args+=("$1"); shift; done
  [[ $# -gt 0 ]] && shift
  echo "=== ${name} build ==="
  cmake -S . -B "build/${name}" -DCMAKE_BUILD_TYPE=RelWithDebInfo "$@" >/dev/null
  cmake --build "build/${name}" -j "${jobs}"
  echo "=== ${name} tests ==="
  (cd "build/${name}" && ctest --output-on-failure -j "${jobs}" "${ctest_args[@]}")
}

build_and_test normal -LE soak-long
if [[ $soak -eq 1 ]]; then
  (cd build/normal && ctest --output-on-failure -L soak-long)
fi

if [[ $quick -eq 0 ]]; then
  export ASAN_OPTIONS=detect_leaks=1:abort_on_error=1:detect_stack_use_after_return=1:intercept_tls_get_addr=0
  export UBSAN_OPTIONS=halt_on_error=1:print_stacktrace=1
  build_and_test asan -LE soak-long -- -DIC_SANITIZE=address,undefined
fi

if [[ $tsan -eq 1 ]]; then
  export TSAN_OPTIONS="halt_on_error=1:second_deadlock_stack=1:detect_deadlocks=1:suppressions=$PWD/scripts/tsan.supp"
  # The installed-package test only rebuilds the consumer; it says nothing
  # about threads.
  build_and_test tsan -LE 'package|soak-long' -- -DIC_SANITIZE=thread
fi

if [[ $i386 -eq 1 ]]; then
  # The installed-package test configures its client without the toolchain
  # file, as a 64-bit build.
  build_and_test i386 -LE 'package|soak-long' -- --toolchain cmake/i386-linux-gnu.cmake
fi

#!/usr/bin/env bash
# Builds the node path-codec fuzz targets with clang (libFuzzer with
# AddressSanitizer and UndefinedBehaviorSanitizer) in build/fuzz and runs each
# of them a fixed number of times, starting from its seed corpus in
# fuzz/corpus/. Inputs the fuzzer finds go to a scratch directory, not into
# the tree. A crash or a failed property fails the run; its input is left in
# build/fuzz/artifacts/ (add it to the target's corpus once fixed). Prints the
# executions per second of each target.
#
#   scripts/fuzz.sh            8,192 runs per target
#   scripts/fuzz.sh RUNS       another count (IC_FUZZ_RUNS works too)
#
# IC_FUZZ_BUILD_DIR names another build directory.
set -euo pipefail
cd "$(dirname "$0")/.."

runs=${1:-${IC_FUZZ_RUNS:-8192}}
targets=(fuzz_stringhex fuzz_b12_topovec fuzz_nodecode fuzz_hex_roundtrip)
build=${IC_FUZZ_BUILD_DIR:-build/fuzz}

scripts/install-deps.sh
# clang and its runtime libraries (libFuzzer, the sanitizers).
packages=(clang libclang-rt-14-dev)
missing=()
for p in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q 'install ok installed' || missing+=("$p")
done
if [[ ${#missing[@]} -gt 0 ]]; then
  sudo=""
  [[ $(id -u) -ne 0 ]] && sudo="sudo"
  export DEBIAN_FRONTEND=noninteractive
  $sudo apt-get update -qq
  $sudo apt-get install -y -qq --no-install-recommends "${missing[@]}"
fi

jobs=$(nproc 2>/dev/null || echo 2)
echo "=== fuzz build ==="
cmake -S . -B "$build" -DCMAKE_BUILD_TYPE=RelWithDebInfo -DCMAKE_CXX_COMPILER=clang++ \
  -DIC_BUILD_TESTS=OFF -DIC_BUILD_PRODUCT=OFF -DIC_BUILD_FUZZERS=ON >/dev/null
cmake --build "$build" -j "$jobs" --target "${targets[@]}"

export ASAN_OPTIONS=${ASAN_OPTIONS:-detect_leaks=1:abort_on_error=1}
export UBSAN_OPTIONS=${UBSAN_OPTIONS:-halt_on_error=1:print_stacktrace=1}
mkdir -p "$build/artifacts"
scratch=$(mktemp -d)
trap 'rm -rf "$scratch"' EXIT
# The codecs log each input they refuse; thousands of lines would only slow
# the run down.
printf 'log4j.rootLogger=OFF\n' >"$scratch/quiet.properties"
export HGLOG_CONFIG="$scratch/quiet.properties"

echo "=== fuzzing, ${runs} runs per target ==="
summary=()
for t in "${targets[@]}"; do
  mkdir -p "$scratch/$t"
  log="$build/$t.log"
  # libFuzzer rounds its own rate down to whole seconds of run time; this
  # one is timed here, start-up and seed corpus included.
  start=$(date +%s.%N)
  if ! "$build/fuzz/$t" -runs="$runs" -print_final_stats=1 \
      -artifact_prefix="$build/artifacts/$t-" "$scratch/$t" "fuzz/corpus/$t" >"$log" 2>&1; then
    tail -n 40 "$log" >&2
    echo "fuzz: $t failed; the input is in $build/artifacts/" >&2
    exit 1
  fi
  end=$(date +%s.%N)
  execs=$(sed -n 's/^stat::number_of_executed_units: *//p' "$log")
  summary+=("$(awk -v t="$t" -v n="$execs" -v a="$start" -v b="$end" \
    'BEGIN { printf "%-20s %8d runs %8.2f s %10.0f execs/s", t, n, b - a, n / (b - a) }')")
done
printf '%s\n' "${summary[@]}"

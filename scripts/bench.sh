#!/usr/bin/env bash
# Builds the benchmarks (Release) and runs them all; extra arguments go to
# every benchmark (e.g. --benchmark_min_time=2).
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/install-deps.sh
cmake -S . -B build/bench -DCMAKE_BUILD_TYPE=Release -DIC_BUILD_TESTS=OFF \
  -DIC_BUILD_BENCHMARKS=ON >/dev/null
cmake --build build/bench -j "$(nproc 2>/dev/null || echo 2)" --target benchmarks
for b in build/bench/benchmarks/bench_*; do
  [[ -x "$b" ]] || continue
  echo "=== $(basename "$b") ==="
  "$b" "$@"
done

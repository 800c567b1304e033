#!/usr/bin/env bash
# The main job: installs what it needs, builds and installs the library, its
# plug-ins, icctl and icd into build/install, then shows this machine's
# hardware with `icctl tree` and a few seconds of `icctl watch`, and starts
# icd for one scrape of its metrics (printing its URL) before stopping it.
#
#   scripts/run.sh                 this machine
#   scripts/run.sh --example large the large example server (examples/sysfs/large)
#   scripts/run.sh --example hostile a tree of hostile numbers and names, written
#                                  by examples/sysfs/make-hostile.sh
#   scripts/run.sh --serve         build and install, then run icd in the
#                                  foreground (ICD_LISTEN, default
#                                  127.0.0.1:9847) until Ctrl-C
#   scripts/run.sh --example bmc   the small server with a simulated BMC
#                                  (examples/bmc, ipmi_sim on 127.0.0.1) as an
#                                  out-of-band BMC of the ipmi plug-in
set -euo pipefail
cd "$(dirname "$0")/.."

example=""
serve=0
cleanup=""
watch_seconds=${IC_WATCH_SECONDS:-5}
while [[ $# -gt 0 ]]; do
  case "$1" in
    --example) example=${2:?--example needs small, large, degraded, hostile or bmc}; shift 2 ;;
    --serve) serve=1; shift ;;
    *) echo "usage: $0 [--example small|large|degraded|hostile|bmc] [--serve]" >&2; exit 2 ;;
  esac
done

scripts/install-deps.sh

prefix="$PWD/build/install"
cmake -S . -B build/release -DCMAKE_BUILD_TYPE=Release -DIC_BUILD_TESTS=OFF \
  -DCMAKE_INSTALL_PREFIX="$prefix" >/dev/null
cmake --build build/release -j "$(nproc 2>/dev/null || echo 2)"
cmake --install build/release >/dev/null

icctl=("$prefix/bin/icctl")
icd=("$prefix/bin/icd")
if [[ "$example" == hostile ]]; then
  examples/sysfs/make-hostile.sh build/examples/hostile >/dev/null
  icctl+=(--sysfs-root build/examples/hostile)
  icd+=(--sysfs-root build/examples/hostile)
elif [[ "$example" == bmc ]]; then
  # The simulator on loopback with its own state and ports, stopped on exit.
  sim="$PWD/build/examples/bmc"
  rm -rf "$sim" && mkdir -p "$sim/state"
  lan=${IC_BMC_PORT:-16230}
  cleanup='examples/bmc/bmcsim.sh stop "$sim/state"'
  trap "$cleanup" EXIT
  examples/bmc/bmcsim.sh start "$sim/state" "$lan" $((lan + 1))
  printf 'icbmc-secret\n' >"$sim/pw" && chmod 600 "$sim/pw"
  cat >"$sim/ipmi.conf" <<EOF
[bmc example]                 # the simulated BMC of examples/bmc
host = 127.0.0.1:$lan
user = monitor
password_file = $sim/pw
privilege = operator
workarounds = opensesspriv    # ipmi_sim needs it
EOF
  export IC_IPMI_CONFIG="$sim/ipmi.conf"
  icctl+=(--sysfs-root examples/sysfs/small)
  icd+=(--sysfs-root examples/sysfs/small)
elif [[ -n "$example" ]]; then
  icctl+=(--sysfs-root "examples/sysfs/$example")
  icd+=(--sysfs-root "examples/sysfs/$example")
fi

if [[ $serve -eq 1 ]]; then
  listen=${ICD_LISTEN:-127.0.0.1:9847}
  echo "=== icd, until Ctrl-C: the page at /, /metrics, /api/v1/nodes ==="
  "${icd[@]}" --listen "$listen"
  exit
fi

echo "=== icctl tree ==="
"${icctl[@]}" tree
if [[ "$example" == bmc ]]; then
  echo
  echo "=== icctl alerts ==="
  "${icctl[@]}" alerts
fi
echo
echo "=== icctl watch (${watch_seconds} s) ==="
"${icctl[@]}" watch --for "$watch_seconds"

echo
echo "=== icd: one scrape ==="
source scripts/icd-lib.sh
trap "icd_stop_quietly; ${cleanup:-}" EXIT
icd_start build/icd.log "${icd[@]}"
curl -fsS --max-time 10 -o build/icd-metrics.txt "$icd_url/metrics"
echo "icd answered at $icd_url/ (page), $icd_url/metrics, $icd_url/api/v1/nodes"
awk '!/^#/ && n++ < 8' build/icd-metrics.txt
echo "... $(grep -vc '^#' build/icd-metrics.txt) samples; scripts/run.sh --serve keeps icd running"
icd_stop

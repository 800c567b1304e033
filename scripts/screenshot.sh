#!/usr/bin/env bash
# Takes docs/icd.png, the README's picture of icd's page: icd on a copy of
# the large example server, the page in headless chromium at 1280x900; CPU
# 0's package is then put above critical, and the picture taken once the
# alert has arrived by the event stream. Both are stopped at the end.
#
#   scripts/screenshot.sh          uses build/install/bin/icd (scripts/run.sh)
#   ICD=path/to/icd scripts/screenshot.sh
set -euo pipefail
cd "$(dirname "$0")/.."
icd=${ICD:-build/install/bin/icd}
[[ -x "$icd" ]] || { echo "screenshot: no $icd; run scripts/run.sh first or set ICD" >&2; exit 1; }
for tool in chromium chromedriver jq curl; do
  command -v "$tool" >/dev/null || { echo "screenshot: $tool is not installed" >&2; exit 1; }
done

source scripts/icd-lib.sh
scratch=$(mktemp -d)
trap 'wd_stop; icd_stop_quietly; rm -rf "$scratch"' EXIT
cp -r examples/sysfs/large "$scratch/box"
IC_LINUXHW_POLL_MS=500 icd_start "$scratch/icd.log" "$icd" --sysfs-root "$scratch/box"
wd_start "$scratch"
# The window's frame would take from the page's height.
wd POST /goog/cdp/execute '{"cmd": "Emulation.setDeviceMetricsOverride", "params":
  {"width": 1280, "height": 900, "deviceScaleFactor": 1, "mobile": false}}' >/dev/null
wd POST /url "{\"url\": \"$icd_url/\"}" >/dev/null
sleep 2
echo 101000 >"$scratch/box/sys/class/hwmon/hwmon0/temp1_input"
sleep 3
wd GET /screenshot | base64 -d >docs/icd.png
wd_stop
icd_stop
echo "screenshot: docs/icd.png"

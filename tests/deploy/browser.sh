#!/usr/bin/env bash
# icd's page in a real browser (headless Debian chromium through
# chromedriver) on the large example server: the tree shows every node with
# its reading; then a CPU package goes above critical under the running
# icd, and the page, from its event stream alone, counts the event, lists
# the alert with its node and colours that node critical.
#
#   browser.sh ICD SOURCE_DIR ICD_ARGS...
source "$(dirname "$0")/lib.sh"
icd=$1 src=$2
shift 2
for tool in chromium chromedriver jq; do
  command -v "$tool" >/dev/null || ic_skip "$tool is not installed (scripts/install-deps.sh installs chromium, chromium-driver and jq)"
done
trap 'wd_stop; icd_stop_quietly; rm -rf "$ic_work"' EXIT

ic_box "$src"
IC_LINUXHW_POLL_MS=200 ic_start_icd "$icd" "$@" --sysfs-root "$box"
nodes=$(curl -fsS --max-time 10 "$icd_url/api/v1/nodes")
count=$(jq .count <<<"$nodes")
hot=$(jq -r --arg d "$ic_hot_sensor" '.. | objects | select(.description? == $d) | .path' <<<"$nodes")
[[ $count -gt 50 && -n "$hot" ]] || ic_fail "the API shows $count nodes, '$ic_hot_sensor' at '$hot'"

wd_start "$ic_work" || ic_fail "chromedriver did not open a session"
wd POST /url "{\"url\": \"$icd_url/\"}" >/dev/null
row="document.querySelector('#tree .node[data-path=\"$hot\"]')"
is() { [[ "$(wd_eval "$1")" == "$2" ]]; }
ic_wait_until "the tree in the page" is "document.querySelectorAll('#tree .node').length" "$count"
ic_expect "$(wd_eval "$row.firstChild.textContent")" "the hot sensor's row before" \
  "^Temperature Sensor 1: $ic_hot_sensor[0-9.]+ C \(ok\)$hot\$"
# What is wrong at start (the large server's DIMM with corrected errors, and
# its roll-up) is listed on the first look, before any event.
at_start=$(curl -fsS --max-time 10 "$icd_url/api/v1/alerts" | jq .count)
[[ $at_start -gt 0 ]] || ic_fail "no alert asserted at start"
is "document.querySelectorAll('#alerts .alert').length" "$at_start" || ic_fail "the page does not list the $at_start alerts asserted at start"

ic_overheat
ic_wait_until "the alert in the page" is "document.querySelector('#alerts .alert[data-path=\"$hot\"]') !== null" true
ic_wait_until "the critical state in the tree" is "$row.classList.contains('state-critical')" true
# The chassis row shows the roll-up, turned critical by the overheat.
ic_wait_until "the roll-up on the chassis row" is \
  "document.querySelector('#tree .node[data-path=\"1f201f5c\"]').classList.contains('rollup-critical')" true
# The chassis' health roll-up follows; the page lists what the API does.
ic_wait_until "the page's alerts to match the API's" is "document.querySelectorAll('#alerts .alert').length" \
  "$(sleep 1; curl -fsS "$icd_url/api/v1/alerts" | jq .count)"
ic_expect "$(wd_eval "document.querySelector('#alerts .alert[data-path=\"$hot\"]').textContent")" \
  "the alert's row" "^criticalthresholdTemperature Sensor 1: $ic_hot_sensor$hot"
ic_expect "$(wd_eval "$row.firstChild.textContent")" "the hot sensor's row after" "101(\.0)? C \(critical\)"
ic_expect "$(wd_eval "document.getElementById('status').textContent")" "status" '^[1-9][0-9]* events? received$'
wd_stop
ic_stop_icd
echo "page: $count nodes, the alert and the critical state arrived by events"

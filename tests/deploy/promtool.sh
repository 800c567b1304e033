#!/usr/bin/env bash
# icd's /metrics on the large example server, with a critical alert
# asserted, under `promtool check metrics` (Debian's prometheus): no parse
# error and no lint problem. Also what Prometheus itself would refuse or
# regret at ingestion: a series twice in one scrape, or a label that names a
# hwmonN directory (those numbers change across boots).
#
#   promtool.sh ICD SOURCE_DIR ICD_ARGS...
source "$(dirname "$0")/lib.sh"
icd=$1 src=$2
shift 2
promtool=$(command -v promtool || echo "$src/build/deps/usr/bin/promtool")
[[ -x "$promtool" ]] || ic_skip "promtool is not installed (scripts/install-deps.sh takes it from Debian's prometheus package)"

ic_box "$src"
IC_LINUXHW_POLL_MS=200 ic_start_icd "$icd" "$@" --sysfs-root "$box"
ic_overheat
scrape() { curl -fsS --max-time 10 -o "$ic_work/metrics" "$icd_url/metrics"; }
ic_wait_until "the threshold alert in /metrics" \
  eval 'scrape && grep -q "^ic_alert_asserted{.*class=\"threshold\"" "$ic_work/metrics"'
ic_stop_icd

rc=0
out=$("$promtool" check metrics <"$ic_work/metrics" 2>&1) || rc=$?
[[ $rc -eq 0 ]] || ic_fail "promtool check metrics (status $rc):"$'\n'"$out"
ic_expect "$(cat "$ic_work/metrics")" "metrics" \
  '^ic_sensor_value\{' '^ic_sensor_threshold\{' '^ic_node_state\{' '^ic_node_info\{' \
  '^ic_alert_asserted\{' '^ic_build_info\{' '^ic_plugins_loaded\{'
dups=$(grep -v '^#' "$ic_work/metrics" | sed 's/ [^ ]*$//' | sort | uniq -d)
[[ -z "$dups" ]] || ic_fail "series given twice:"$'\n'"$dups"
! grep -E '^[a-z_]+\{[^}]*hwmon[0-9]' "$ic_work/metrics" || ic_fail "labels name hwmon directories"
echo "promtool check metrics: $(grep -vc '^#' "$ic_work/metrics") samples, no problems"

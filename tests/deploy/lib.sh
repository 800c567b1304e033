# Shared by the deployment test drivers (sourced): a scratch directory, icd
# on a free loopback port, and everything stopped and removed when the
# driver exits, however it ends.
set -euo pipefail
source "$(dirname "${BASH_SOURCE[0]}")/../../scripts/icd-lib.sh"

ic_work=$(mktemp -d "${TMPDIR:-/tmp}/ic-deploy.XXXXXX")
trap 'icd_stop_quietly; rm -rf "$ic_work"' EXIT

# ctest counts exit status 77 as skipped (SKIP_RETURN_CODE).
ic_fail() {
  echo "FAIL: $*" >&2
  if [[ -s "$ic_work/icd.log" ]]; then tail -n 20 "$ic_work/icd.log" >&2; fi
  exit 1
}
ic_skip() { echo "SKIP: $*"; exit 77; }

command -v curl >/dev/null || ic_fail "curl is not installed (scripts/install-deps.sh installs it)"

ic_start_icd() { icd_start "$ic_work/icd.log" "$@" || ic_fail "icd did not start"; }
# SIGTERM, and icd must end by itself with status 0.
ic_stop_icd() {
  local rc=0
  icd_stop || rc=$?
  [[ $rc -eq 0 ]] || ic_fail "icd ended with status $rc on SIGTERM"
}

# ic_expect TEXT WHAT PATTERN...: every extended regular expression must
# match a line of TEXT.
ic_expect() {
  local text=$1 what=$2 p
  shift 2
  for p in "$@"; do
    grep -Eq -- "$p" <<<"$text" || ic_fail "$what: nothing matches '$p'"
  done
}

# ic_box SOURCE_DIR: a copy of the large example server in the scratch
# directory, for the tests to change under a running icd; sets box.
ic_box() {
  box=$ic_work/box
  cp -r "$1/examples/sysfs/large" "$box"
}
# The first CPU package's sensor: its description, and the reading that puts
# it above critical (101 C; critical is 100 C).
ic_hot_sensor="CPU 0 Package id 0 temperature"
ic_overheat() { echo 101000 >"$box/sys/class/hwmon/hwmon0/temp1_input"; }

# ic_wait_until WHAT COMMAND...: runs COMMAND every 0.2 s until it succeeds,
# for at most 20 s.
ic_wait_until() {
  local what=$1 i
  shift
  for i in $(seq 100); do
    "$@" && return 0
    sleep 0.2
  done
  ic_fail "timed out waiting for $what"
}

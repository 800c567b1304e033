# Sourced by scripts and the deployment tests: icd_start runs icd in the
# background on a free loopback port until it answers; icd_stop ends it. The
# caller stops it on exit too (trap icd_stop_quietly EXIT). wd_* drive a
# headless chromium.

icd_pid=""
icd_url=""

# icd_start LOG ICD ARGS...: starts `ICD ARGS --listen 127.0.0.1:0` (a port
# the system picks), its output to LOG, and waits until it says where it
# listens and /metrics answers there; sets icd_pid and icd_url.
icd_start() {
  local log=$1 bin=$2 i
  shift 2
  "$bin" "$@" --listen 127.0.0.1:0 >"$log" 2>&1 &
  icd_pid=$!
  for i in $(seq 200); do
    icd_url=$(sed -n 's|^icd: listening on \(http://[^ ]*[^/ ]\)/*$|\1|p' "$log" | head -n 1)
    if [[ -n "$icd_url" ]] && curl -fsS -o /dev/null --max-time 5 "$icd_url/metrics" 2>/dev/null; then
      return 0
    fi
    kill -0 "$icd_pid" 2>/dev/null || break
    sleep 0.1
  done
  echo "icd did not answer on 127.0.0.1; its output:" >&2
  tail -n 20 "$log" >&2
  icd_stop_quietly
  return 1
}

# icd_stop: SIGTERM; returns icd's exit status.
icd_stop() {
  local rc=0
  kill -TERM "$icd_pid" 2>/dev/null || true
  wait "$icd_pid" || rc=$?
  icd_pid=""
  return "$rc"
}

icd_stop_quietly() {
  [[ -n "$icd_pid" ]] || return 0
  icd_stop 2>/dev/null || true
}

# A headless Debian chromium driven through chromedriver (WebDriver, plain
# HTTP and JSON): the page holds its event stream open, so chromium's own
# --dump-dom and --screenshot, taken at the load event or after virtual time
# that an open stream never lets pass, cannot show what the events did.
wd_pid=""
wd_url=""

# wd_start WORK_DIR: starts chromedriver on a free loopback port and opens a
# session of 1280x900 with a fresh profile in WORK_DIR; sets wd_url to the
# session's URL.
wd_start() {
  local work=$1 port caps i sid
  port=$((20000 + RANDOM % 40000))
  chromedriver --port="$port" --allowed-ips=127.0.0.1 >"$work/chromedriver.log" 2>&1 &
  wd_pid=$!
  for i in $(seq 50); do
    curl -fsS -o /dev/null "http://127.0.0.1:$port/status" 2>/dev/null && break
    sleep 0.1
  done
  caps=$(jq -n --arg profile "$work/profile" '{capabilities: {alwaysMatch: {browserName: "chrome",
    "goog:chromeOptions": {binary: "/usr/bin/chromium", args: ["--headless", "--no-sandbox",
      "--disable-gpu", "--disable-quic", "--no-first-run", "--disable-background-networking",
      "--disable-component-update", "--disable-sync", "--hide-scrollbars",
      "--window-size=1280,900", ("--user-data-dir=" + $profile)]}}}}')
  sid=$(curl -fsS -X POST -H 'Content-Type: application/json' -d "$caps" \
    "http://127.0.0.1:$port/session" | jq -r .value.sessionId) || return 1
  wd_url="http://127.0.0.1:$port/session/$sid"
}

# wd POST|GET|DELETE PATH [JSON]: one WebDriver command; prints its value.
wd() {
  curl -fsS -X "$1" -H 'Content-Type: application/json' ${3:+-d "$3"} "$wd_url$2" | jq -r .value
}

# wd_eval EXPRESSION: the expression's value in the page, as text.
wd_eval() { wd POST /execute/sync "$(jq -n --arg e "$1" '{script: ("return " + $e), args: []}')"; }

wd_stop() {
  [[ -n "$wd_pid" ]] || return 0
  [[ -n "$wd_url" ]] && curl -fsS -X DELETE -o /dev/null "$wd_url" 2>/dev/null
  kill "$wd_pid" 2>/dev/null || true
  wait "$wd_pid" 2>/dev/null || true
  wd_pid=""
  wd_url=""
}

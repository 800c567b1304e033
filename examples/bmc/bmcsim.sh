#!/usr/bin/env bash
# Starts, drives and stops the simulated BMC (ipmi_sim from Debian's openipmi)
# on 127.0.0.1, each instance with its own state directory and ports.
#   bmcsim.sh start STATE_DIR LAN_PORT CONSOLE_PORT
#   bmcsim.sh cmd   STATE_DIR "sensor_set_value 0x20 0 1 95 1"
#   bmcsim.sh stop  STATE_DIR
# User "monitor", password "icbmc-secret"; FreeIPMI needs -W opensesspriv.
set -euo pipefail
here=$(cd "$(dirname "$0")" && pwd)
action=${1:?start, cmd or stop}
state=${2:?state directory}

# One console command. The simulator dies of SIGPIPE when a client leaves
# before reading the prompt, so read up to the prompt after the command.
console() {
  local port
  port=$(cat "$state/console_port")
  exec 3<>"/dev/tcp/127.0.0.1/$port"
  IFS= read -r -t 5 -d '>' _ <&3 || true
  printf '%s\n' "$1" >&3
  IFS= read -r -t 5 -d '>' reply <&3 || true
  exec 3>&- 3<&-
  printf '%s' "${reply:-}" | sed -e 's/^[[:space:]]*//' -e '/^$/d'
}

case "$action" in
start)
  lan=${3:?LAN port} con=${4:?console port}
  command -v ipmi_sim >/dev/null || { echo "ipmi_sim is not installed (Debian package openipmi)" >&2; exit 2; }
  mkdir -p "$state/ipmi_sim/icbmc"
  sdrcomp -o "$state/ipmi_sim/icbmc/sdr.20.main" "$here/bmc.sdrs"
  sed -e "s/@LAN_PORT@/$lan/" -e "s/@CONSOLE_PORT@/$con/" "$here/lan.conf.in" >"$state/lan.conf"
  echo "$con" >"$state/console_port"
  ipmi_sim -n -c "$state/lan.conf" -f "$here/bmc.emu" -s "$state" </dev/null >"$state/ipmi_sim.log" 2>&1 &
  echo $! >"$state/pid"
  for _ in $(seq 50); do
    # the probe must read the prompt too (see console above)
    (console "") >/dev/null 2>&1 && exit 0
    kill -0 "$(cat "$state/pid")" 2>/dev/null || break
    sleep 0.1
  done
  echo "ipmi_sim did not start; see $state/ipmi_sim.log" >&2
  exit 1 ;;
cmd)
  console "${3:?command}" ;;
stop)
  [[ -f "$state/pid" ]] || exit 0
  pid=$(cat "$state/pid")
  kill -CONT "$pid" 2>/dev/null || true
  console quit >/dev/null 2>&1 || true
  for _ in $(seq 30); do kill -0 "$pid" 2>/dev/null || { rm -f "$state/pid"; exit 0; }; sleep 0.1; done
  kill "$pid" 2>/dev/null || true
  rm -f "$state/pid" ;;
*) echo "unknown action $action" >&2; exit 2 ;;
esac

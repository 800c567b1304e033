#!/usr/bin/env bash
# Writes a sysfs tree with 100,000 sensors: the small example box plus
# CHIPS hwmon chips (default 5,000) of SENSORS temperature inputs each
# (default 20), each chip on its own platform device.
#   examples/sysfs/make-huge.sh /tmp/huge [CHIPS] [SENSORS]
set -euo pipefail
out=${1:?usage: make-huge.sh DIR [CHIPS] [SENSORS]}
chips=${2:-5000}
sensors=${3:-20}
here=$(cd "$(dirname "$0")" && pwd)
[[ -e "$out" ]] && { echo "make-huge.sh: $out exists" >&2; exit 1; }
cp -r "$here/small" "$out"
hwmon="$out/sys/class/hwmon"
platform="$out/sys/devices/platform"
for ((c = 1; c <= chips; c++)); do
  dir="$hwmon/hwmon$c"
  mkdir -p "$dir" "$platform/nct6775.$c"
  echo "DRIVER=nct6775" > "$platform/nct6775.$c/uevent"
  ln -s "../../../devices/platform/nct6775.$c" "$dir/device"
  echo nct6779 > "$dir/name"
  for ((s = 1; s <= sensors; s++)); do
    echo $((30000 + (c * 7 + s * 13) % 20000)) > "$dir/temp${s}_input"
  done
done
echo "$out: $((chips * sensors)) hwmon sensors on $chips chips"

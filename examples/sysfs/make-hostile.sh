#!/usr/bin/env bash
# Writes a sysfs tree that a broken driver, buggy firmware or a malicious
# device name could produce: the small example box with hostile numbers
# (overflowing sizes, embedded NULs, signs, exponents, 64-bit limits) and
# hostile names in every source linuxhw reads names from (DMI strings, the
# hostname, hwmon chip names, sensor labels, network interface and power
# supply names) holding ESC sequences, newlines, carriage returns, DEL, C1
# controls and invalid UTF-8.
#
#   examples/sysfs/make-hostile.sh DIR     (DIR must not exist, or be a tree
#                                            this script wrote before)
#   icctl --sysfs-root DIR tree
set -euo pipefail

dir=${1:?usage: $0 DIR}
here=$(cd "$(dirname "$0")" && pwd)
marker=.hostile-tree
if [[ -e "$dir" ]]; then
  [[ -e "$dir/$marker" ]] || { echo "$0: $dir exists and is not a hostile tree; not touching it" >&2; exit 2; }
  rm -rf -- "$dir"
fi
mkdir -p "$(dirname "$dir")"
cp -r "$here/small" "$dir"
touch "$dir/$marker"
cd "$dir"

# put FILE FORMAT [ARGS]: printf's escapes make the bytes (\0 a NUL, \033 ESC).
put() {
  local file=$1
  shift
  mkdir -p "$(dirname "$file")"
  # shellcheck disable=SC2059
  printf -- "$@" >"$file"
}

esc_title='\033]0;pwned\007'     # sets the terminal title
esc_clear='\033[2J\033[H'        # clears the screen
forged='\nROOT 0: forged line'   # only where a name is a file name: files are read to their first line

# ---- names
dmi=sys/class/dmi/id
put $dmi/sys_vendor "Acme${esc_title}\n"
put $dmi/product_name "Edge${esc_clear}E10\n"
put $dmi/product_serial 'E10\177\177\177000123\n'         # DEL
put $dmi/board_name 'Board\302\233\061m C1\n'            # U+009B (CSI) as UTF-8
put $dmi/bios_vendor 'Acme\233\061mFirmware\n'           # a lone C1 byte: invalid UTF-8
put $dmi/bios_version '1.4.2\377\376\n'                  # invalid UTF-8
put proc/sys/kernel/hostname 'edge\033[31mred\033[0m01\n'

hw=sys/class/hwmon/hwmon0
put $hw/name 'coretemp\033[5m\n'
put $hw/temp2_label 'Core 0\rPackage id 7 label forged by a carriage return\n'
put $hw/temp3_label 'Core 1\177\n'
put $hw/temp4_label 'Core 2\302\205NEL\n'                # U+0085
put $hw/temp5_label 'Core 3\300\200\n'                   # overlong NUL: invalid UTF-8

chip=sys/class/hwmon/hwmon1
put $chip/name 'nct\0336779\n'
put $chip/temp1_label "SYSTIN${esc_title}\n"
put $chip/temp1_input '41000\n'

net=sys/class/net
for name in "$(printf "eth${esc_clear}0")" "$(printf "eth1${forged}")" "$(printf 'eth2\177\233')"; do
  put "$net/$name/address" '02:00:00:00:00:01\n'
  put "$net/$name/carrier" '1\n'
  put "$net/$name/device/uevent" 'PCI_SLOT_NAME=0000:05:00.0\n'
done

psu=sys/class/power_supply
for name in "$(printf "PSU1${forged}")" "$(printf "PSU2${esc_title}")" "$(printf 'PSU3\302\237')"; do
  put "$psu/$name/type" 'Mains\n'
  put "$psu/$name/online" '1\n'
done

# ---- numbers
put sys/block/nvme0n1/size '99999999999999999\n'          # bytes overflow 64 bits
for n in 1 2 3 4 5 6 7 8; do
  mkdir -p "sys/block/h$n/device"
done
put sys/block/h1/size '18014398509481983\n'               # fits, but not when rounded to GB naively
put sys/block/h2/size '9223372036854775807\n'
put sys/block/h3/size '9223372036854775808\n'
put sys/block/h4/size '18446744073709551616\n'
put sys/block/h5/size '-1\n'
put sys/block/h6/size '1e9\n'
put sys/block/h7/size '+512\n'
put sys/block/h8/size '4\000096\n'                       # an embedded NUL
put $hw/temp1_input '4\0005000\n'
put $hw/temp2_input '-9223372036854775809\n'
put $hw/temp3_input '9223372036854775807\n'
put $hw/temp4_input '4.5e4\n'
put $hw/temp5_input '45000\000\n'
put $hw/temp1_max '99999999999999999999\n'
put $hw/temp2_crit_alarm '-1\n'
put $chip/fan1_input '-1\n'
put $chip/fan2_input '18446744073709551615\n'
put $chip/in1_input '-12000\n'
mc=sys/devices/system/edac/mc/mc0
for n in 0 1 2 3; do
  put $mc/dimm$n/dimm_label "DIMM$n\n"
  put $mc/dimm$n/size '16384\n'
done
put $mc/dimm0/size '-1\n'
put $mc/dimm1/dimm_ce_count '-3\n'
put $mc/dimm2/dimm_ce_count '18446744073709551616\n'
put $mc/dimm3/dimm_ue_count '1\0001\n'
put proc/meminfo 'MemTotal:       99999999999999999999 kB\n'
put "$psu/$(printf 'PSU3\302\237')/capacity" '101\n'
put "$net/$(printf 'eth2\177\233')/speed" '99999999999999999999\n'
echo "hostile tree written to $dir"

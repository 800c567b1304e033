#!/usr/bin/env bash
# The Debian package: built by cpack from the build directory, installed by
# dpkg into an empty root (maintainer scripts run outside a chroot, as for
# any --root install), its programs run from there on the large example
# server, then purged.
#
#   deb.sh BUILD_DIR SOURCE_DIR
source "$(dirname "$0")/lib.sh"
build=$1 src=$2
large=$src/examples/sysfs/large

for tool in dpkg-deb dpkg-shlibdeps; do
  command -v "$tool" >/dev/null || ic_fail "$tool is not installed (dpkg-dev)"
done

(cd "$ic_work" && cpack -G DEB --config "$build/CPackConfig.cmake" -B "$ic_work/out") \
  >"$ic_work/cpack.log" 2>&1 || { cat "$ic_work/cpack.log" >&2; ic_fail "cpack -G DEB"; }
debs=("$ic_work"/out/*.deb)
[[ ${#debs[@]} -eq 1 && -f ${debs[0]} ]] || ic_fail "cpack made ${debs[*]}, not one .deb"
deb=${debs[0]}

# Metadata: the shared-library dependencies were worked out, /etc/default/icd
# survives an upgrade as a conffile, and the libraries refresh the loader's
# cache.
ic_expect "$(dpkg-deb -f "$deb" Package Version Depends Maintainer Description)" "control" \
  '^Package: instrumentationcontrol$' '^Version: [0-9]+\.[0-9]+\.[0-9]+-1$' \
  '^Depends: .*libc6 .*liblog4cxx[0-9]+ ' '^Maintainer: .+<.+>' '^Description: .+'
ic_expect "$(dpkg-deb -I "$deb" conffiles)" "conffiles" '^/etc/default/icd$'
ic_expect "$(dpkg-deb -I "$deb" triggers)" "triggers" '^activate-noawait ldconfig$'
version=$(dpkg-deb -f "$deb" Version)
version=${version%-*}

root=$ic_work/root
mkdir -p "$root/var/lib/dpkg/info" "$root/var/lib/dpkg/updates"
: >"$root/var/lib/dpkg/status"
# The empty root has no libc or systemd to depend on; the programs run with
# this machine's.
dpkg=(dpkg --root="$root" --force-script-chrootless --force-not-root --log=/dev/null)
"${dpkg[@]}" --force-depends -i "$deb" >"$ic_work/dpkg.log" 2>&1 \
  || { cat "$ic_work/dpkg.log" >&2; ic_fail "dpkg -i"; }

for f in usr/bin/icd usr/bin/icctl usr/lib/systemd/system/icd.service etc/default/icd \
    usr/include/IC/InstrumentationControl.h; do
  [[ -e "$root/$f" ]] || ic_fail "the package did not install /$f"
done
for f in pkgconfig/instrumentationcontrol.pc cmake/InstrumentationControl/InstrumentationControlConfig.cmake \
    instrumentationcontrol/mi/linuxhw.so instrumentationcontrol/fp/health.so; do
  compgen -G "$root/usr/lib/$f" >/dev/null || compgen -G "$root/usr/lib/*/$f" >/dev/null \
    || ic_fail "the package did not install /usr/lib/.../$f"
done

# The unit as installed, pointing at the installed icd.
if command -v systemd-analyze >/dev/null; then
  sed "s|/usr/bin/icd|$root/usr/bin/icd|" "$root/usr/lib/systemd/system/icd.service" >"$ic_work/icd.service"
  out=$(cd "$ic_work" && systemd-analyze verify --man=no ./icd.service 2>&1) \
    && [[ -z "$out" ]] || ic_fail "systemd-analyze verify icd.service: $out"
else
  echo "note: systemd-analyze is not installed; the unit is not verified"
fi

# Installed programs find the plug-ins beside the installed library, with
# nothing in the environment to help.
unset IC_MI_DIR IC_FP_DIR IC_DATA_DIR IC_SYSFS_ROOT HGLOG_CONFIG
ic_expect "$("$root/usr/bin/icctl" --sysfs-root "$large" tree)" "installed icctl tree" \
  '^ROOT' 'Temperature Sensor' 'Fan'
ic_expect "$("$root/usr/bin/icd" --version)" "icd --version" "${version//./\\.}"
ic_expect "$("$root/usr/bin/icctl" --version)" "icctl --version" "${version//./\\.}"

ic_start_icd "$root/usr/bin/icd" --sysfs-root "$large"
ic_expect "$(curl -fsS --max-time 10 "$icd_url/metrics")" "installed icd /metrics" \
  '^ic_build_info\{.*\} 1$' '^ic_sensor_value\{.*path="[0-9a-f]+".*\} -?[0-9]'
ic_stop_icd

"${dpkg[@]}" -P instrumentationcontrol >"$ic_work/dpkg.log" 2>&1 \
  || { cat "$ic_work/dpkg.log" >&2; ic_fail "dpkg -P"; }
for f in usr/bin/icd etc/default/icd; do
  [[ ! -e "$root/$f" ]] || ic_fail "/$f is still there after dpkg -P"
done
echo "package $(basename "$deb"): installed, icd and icctl ran, purged"

#!/usr/bin/env bash
# Installs the Debian packages the build and the tests need. Skips apt when
# everything is already there, except on CI, which always asks apt.
#
# The browser and promtool tests of icd skip when chromium or promtool could
# not be had. promtool is taken out of Debian's prometheus package into
# build/deps/ rather than installed: installing it would start a Prometheus
# server.
set -euo pipefail
cd "$(dirname "$0")/.."

packages=(
  build-essential cmake pkg-config binutils
  libgtest-dev libgmock-dev
  liblog4cxx-dev
  libcli11-dev nlohmann-json3-dev
  libbenchmark-dev
  libcpp-httplib-dev libssl-dev libcrypt-dev libsystemd-dev
  dpkg-dev curl jq
  openipmi freeipmi-tools libipmimonitoring-dev libfreeipmi-dev
)
optional=(chromium chromium-driver)

installed() { dpkg-query -W -f='${Status}' "$1" 2>/dev/null | grep -q 'install ok installed'; }

sudo=""
[[ $(id -u) -ne 0 ]] && sudo="sudo"
# --i386: also what the 32-bit x86 form needs (scripts/test.sh --i386): the
# compiler's 32-bit libraries and the i386 builds of the libraries linked.
if [[ "${1:-}" == "--i386" ]]; then
  dpkg --print-foreign-architectures | grep -qx i386 || $sudo dpkg --add-architecture i386
  packages+=(g++-multilib liblog4cxx-dev:i386 libgtest-dev:i386 libgmock-dev:i386 libssl-dev:i386 libcrypt-dev:i386)
fi

missing=()
for p in "${packages[@]}" "${optional[@]}"; do
  installed "$p" || missing+=("$p")
done
have_promtool() { command -v promtool >/dev/null || [[ -x build/deps/usr/bin/promtool ]]; }

if [[ ${#missing[@]} -gt 0 || "${CI:-}" == "true" ]] || ! have_promtool; then
  export DEBIAN_FRONTEND=noninteractive
  $sudo apt-get update -qq
  $sudo apt-get install -y -qq --no-install-recommends "${packages[@]}"
  for p in "${optional[@]}"; do
    installed "$p" || $sudo apt-get install -y -qq --no-install-recommends "$p" \
      || echo "install-deps: $p did not install; the tests that need it will skip" >&2
  done
  if ! have_promtool; then
    scratch=$(mktemp -d) && chmod 755 "$scratch"
    if (cd "$scratch" && apt-get download -qq -o APT::Sandbox::User=root prometheus); then
      mkdir -p build/deps && dpkg -x "$scratch"/prometheus_*.deb build/deps
    else
      echo "install-deps: prometheus did not download; the promtool test will skip" >&2
    fi
    rm -rf "$scratch"
  fi
fi

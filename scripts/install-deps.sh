#!/usr/bin/env bash
# Installs the Debian packages the build and the tests need. Skips apt when
# everything is already there, except on CI, which always asks apt.
set -euo pipefail

packages=(
  build-essential cmake pkg-config binutils
  libgtest-dev libgmock-dev
  liblog4cxx-dev
  libcli11-dev nlohmann-json3-dev
  libbenchmark-dev
)

sudo=""
[[ $(id -u) -ne 0 ]] && sudo="sudo"
# --i386: also what the 32-bit x86 form needs (scripts/test.sh --i386): the
# compiler's 32-bit libraries and the i386 builds of the libraries linked.
if [[ "${1:-}" == "--i386" ]]; then
  dpkg --print-foreign-architectures | grep -qx i386 || $sudo dpkg --add-architecture i386
  packages+=(g++-multilib liblog4cxx-dev:i386 libgtest-dev:i386 libgmock-dev:i386)
fi

missing=()
for p in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q 'install ok installed' || missing+=("$p")
done

if [[ ${#missing[@]} -gt 0 || "${CI:-}" == "true" ]]; then
  export DEBIAN_FRONTEND=noninteractive
  $sudo apt-get update -qq
  $sudo apt-get install -y -qq --no-install-recommends "${packages[@]}"
fi

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
  openipmi freeipmi-tools libipmimonitoring-dev libfreeipmi-dev
)

missing=()
for p in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q 'install ok installed' || missing+=("$p")
done

if [[ ${#missing[@]} -gt 0 || "${CI:-}" == "true" ]]; then
  sudo=""
  [[ $(id -u) -ne 0 ]] && sudo="sudo"
  export DEBIAN_FRONTEND=noninteractive
  $sudo apt-get update -qq
  $sudo apt-get install -y -qq --no-install-recommends "${packages[@]}"
fi

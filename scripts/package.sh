#!/usr/bin/env bash
# Builds the Debian package: a Release build configured for /usr in
# build/deb, then `cpack -G DEB`. Prints the package's name; install it with
# `apt install ./build/deb/instrumentationcontrol_*.deb`.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/install-deps.sh
cmake -S . -B build/deb -DCMAKE_BUILD_TYPE=Release -DIC_BUILD_TESTS=OFF \
  -DCMAKE_INSTALL_PREFIX=/usr >/dev/null
cmake --build build/deb -j "$(nproc 2>/dev/null || echo 2)"
(cd build/deb && cpack -G DEB >/dev/null)
ls build/deb/*.deb

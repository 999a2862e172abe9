#!/bin/sh
# Builds Velmor with clang, AddressSanitizer and UndefinedBehaviorSanitizer and
# runs every test: the unit tests, the end-to-end tests against real clients,
# and each libFuzzer target for 20 seconds. ccache keeps rebuilds short.
set -eu
cd "$(dirname "$0")"
. ./scripts/deps.sh
velmor_install_deps

jobs="${VELMOR_JOBS:-$(nproc)}"
CXX=clang++ cmake -S . -B build -G Ninja -DVELMOR_SANITIZE=ON -DVELMOR_FUZZ=ON \
  -DCMAKE_BUILD_TYPE=RelWithDebInfo
ninja -C build -j"$jobs"
cd build
ctest --output-on-failure -j"$jobs"

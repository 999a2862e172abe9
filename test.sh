#!/bin/sh
# Builds Velmor with AddressSanitizer and UndefinedBehaviorSanitizer and runs
# every test: the unit tests and the end-to-end tests against real clients.
set -eu
cd "$(dirname "$0")"
. ./scripts/deps.sh
velmor_install_deps

jobs="${VELMOR_JOBS:-$(nproc)}"
cmake -S . -B build -G Ninja -DVELMOR_SANITIZE=ON -DCMAKE_BUILD_TYPE=RelWithDebInfo
ninja -C build -j"$jobs"
cd build
ctest --output-on-failure -j"$jobs"

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
status=0
ctest --output-on-failure -j"$jobs" --output-junit ctest-results.xml || status=$?
# One line per area (unit tests of a folder, end-to-end tests of a file, the
# fuzz targets), so the end of the output says what failed.
python3 ../scripts/test_summary.py ctest-results.xml || true
exit "$status"

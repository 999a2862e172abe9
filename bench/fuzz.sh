#!/bin/sh
# Runs every libFuzzer target for a long time, one after the other, each on
# its own corpus (kept between runs, seeded from <folder>/fuzz/<what>/), and
# prints per target the executions done and the findings (crash, leak,
# timeout and out-of-memory inputs, kept in the findings folder).
#
#   bench/fuzz.sh [SECONDS]     SECONDS per target, 600 by default
#   TARGETS="line_reader smtp_session" bench/fuzz.sh 3600   only these
#   BUILD=build bench/fuzz.sh 60      the fuzz targets of an existing build
set -eu
SECONDS_EACH=${1:-600}
HERE=$(cd "$(dirname "$0")/.." && pwd)
BUILD=${BUILD:-$HERE/build-fuzz}
WORK=${WORK:-$BUILD/fuzz-runs}

# A build folder of its own unless BUILD names one made with -DVELMOR_FUZZ=ON.
if [ ! -f "$BUILD/CMakeCache.txt" ]; then
  CXX=${CXX:-clang++} cmake -S "$HERE" -B "$BUILD" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo \
    -DVELMOR_SANITIZE=ON -DVELMOR_FUZZ=ON -DVELMOR_TESTS=OFF >/dev/null
fi
ninja -C "$BUILD" -j2 $(cd "$BUILD" && ninja -t targets all | sed -n 's/^\(fuzz_[a-z0-9_]*\): .*/\1/p' | sort -u) >/dev/null

total_findings=0
for binary in $(find "$BUILD" -type f -name 'fuzz_*' -perm -u+x | sort); do
  what=${binary##*/fuzz_}
  if [ -n "${TARGETS:-}" ] && ! printf ' %s ' "$TARGETS" | grep -q " $what "; then continue; fi
  seeds=$(find "$HERE" -path "$HERE/build*" -prune -o -type d -path "*/fuzz/$what" -print | head -n 1)
  corpus="$WORK/$what/corpus"
  findings="$WORK/$what/findings"
  mkdir -p "$corpus" "$findings"
  log="$WORK/$what/log"
  # -fork keeps going past a finding, so one run reports all it meets.
  "$binary" -max_total_time="$SECONDS_EACH" -rss_limit_mb=2048 -timeout=10 -fork=1 -ignore_crashes=1 \
    -ignore_timeouts=1 -ignore_ooms=1 -artifact_prefix="$findings/" "$corpus" ${seeds:+"$seeds"} >"$log" 2>&1 || true
  execs=$(sed -n 's/.*stat::number_of_executed_units: *//p; s/^#\([0-9]*\).*exec\/s.*/\1/p' "$log" | tail -n 1)
  found=$(find "$findings" -type f | wc -l)
  total_findings=$((total_findings + found))
  printf '%-18s %12s executions  %3d findings\n' "$what" "${execs:-?}" "$found"
done
echo "findings in all: $total_findings (inputs in $WORK/*/findings)"

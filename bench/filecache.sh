#!/bin/sh
# Builds the file-cache microbenchmark (-O2, no sanitizers) and runs
# it; prints the figures and the ratio of the windowed read of a 10 MB file
# to plain read(2) of the same file (below 1 means the cache is faster).
set -eu
cd "$(dirname "$0")/.."
. ./scripts/deps.sh
VELMOR_PACKAGES="$VELMOR_PACKAGES libbenchmark-dev"
velmor_install_deps

cmake -S . -B build-bench -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo -DVELMOR_SANITIZE=OFF \
  -DVELMOR_TESTS=OFF -DVELMOR_BENCH=ON >/dev/null
ninja -C build-bench -j"${VELMOR_JOBS:-2}" filecache_bench | grep -v "^\[" || true
test -x build-bench/bench/filecache_bench
out="build-bench/filecache_bench.json"
build-bench/bench/filecache_bench --benchmark_repetitions="${REPS:-5}" \
  --benchmark_report_aggregates_only=true --benchmark_out="$out" --benchmark_out_format=json
python3 - "$out" <<'PY'
import json, sys
runs = {b["run_name"]: b for b in json.load(open(sys.argv[1]))["benchmarks"] if b.get("aggregate_name") == "median"}
def ns(name, clock="real_time"):
    b = runs[name]
    return b[clock] * {"ns": 1, "us": 1e3, "ms": 1e6, "s": 1e9}[b["time_unit"]]
size = 10 * 1024 * 1024
for clock in ("real_time", "cpu_time"):
    hit, windows, plain = ns("CacheHit", clock), ns("WindowedRead", clock), ns("PlainRead", clock)
    print(f"{clock} (medians):")
    print(f"  cache hit (open+close): {hit:.0f} ns")
    print(f"  10 MB through windows:  {windows / 1e3:.0f} us ({size / windows * 1e9 / 2**30:.2f} GiB/s)")
    print(f"  10 MB through read(2):  {plain / 1e3:.0f} us ({size / plain * 1e9 / 2**30:.2f} GiB/s)")
    print(f"  ratio windows/read: {windows / plain:.2f}")
PY

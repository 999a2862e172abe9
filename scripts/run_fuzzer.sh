#!/bin/sh
# Runs one libFuzzer target for a fixed time on a scratch corpus, starting
# from its seeds when it has any: run_fuzzer.sh BINARY SECONDS CORPUS [SEEDS]
set -eu
binary=$1 seconds=$2 corpus=$3 seeds=${4:-}
mkdir -p "$corpus"
set -- -max_total_time="$seconds" -rss_limit_mb=2048 -timeout=10 -print_final_stats=1 "$corpus"
[ -n "$seeds" ] && [ -d "$seeds" ] && set -- "$@" "$seeds"
exec "$binary" "$@"

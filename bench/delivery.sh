#!/bin/sh
# Local delivery into big mailboxes: deliveries per second into a mailbox
# holding 0, 10,000 and 50,000 messages, Velmor beside Dovecot's local
# delivery agent (Debian's dovecot-core, private configuration, into an mbox
# and a Maildir), and the largest SMTP-greeting delay during a burst of
# 10,000 deliveries. Run as root (the agent runs as nobody).
#   bench/delivery.sh
# BENCH_SIZES, BENCH_VELMOR_COUNT, BENCH_LDA_COUNT, BENCH_BURST and
# BENCH_ROUNDS change the sizes, the counts and the rounds.
set -eu
HERE=$(cd "$(dirname "$0")/.." && pwd)
BUILD=${BUILD:-$HERE/build-bench}

. "$HERE/bench/quiet_install.sh"
[ -x /usr/lib/dovecot/dovecot-lda ] || quiet_install dovecot-core

cmake -S "$HERE" -B "$BUILD" -G Ninja -DCMAKE_BUILD_TYPE=Release -DVELMOR_TESTS=OFF >/dev/null
ninja -C "$BUILD" -j2 velmor velmorctl >/dev/null
export VELMOR_BIN="$BUILD/velmor" VELMORCTL_BIN="$BUILD/velmorctl"
exec python3 "$HERE/bench/delivery_bench.py"

#!/bin/sh
# What waiting clients cost: 2,000 IMAP connections in IDLE on one mailbox,
# on Velmor and on Dovecot's IMAP server (Debian's package), for a minute
# with one delivery a second. Prints each server's memory (RSS and PSS of
# the whole server), its CPU time over the minute and the delay from a
# delivery to the EXISTS that every client hears, then the ratios.
#   bench/imap_idle.sh [path to a velmor built without sanitizers]
# IDLE_BENCH_CLIENTS and IDLE_BENCH_SECONDS change the numbers.
set -e
cd "$(dirname "$0")/.."
. bench/quiet_install.sh
use_velmor "$1"
need_dovecot imap
exec python3 bench/imap_idle_bench.py

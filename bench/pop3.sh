#!/bin/sh
# POP3 read benchmark: a 5,000-message mailbox read with LIST, UIDL and RETR
# of every message, from Velmor and from Dovecot's POP3 server (Debian's
# package), both on loopback over the same messages.
#   bench/pop3.sh [path to a velmor built without sanitizers]
# POP3_BENCH_MESSAGES and POP3_BENCH_ROUNDS change the size and the rounds.
set -e
cd "$(dirname "$0")/.."
. bench/quiet_install.sh
use_velmor "$1"
need_dovecot pop3
exec python3 bench/pop3_bench.py

#!/bin/sh
# POP3 client benchmark: the suite's POP3 client collects a 5,000-message
# mailbox from a private Dovecot (Debian's dovecot-pop3d) into its incoming
# queue, against fetchmail collecting the same mailbox (restored before
# each run) with --bsmtp into one file; both delete on the server. Prints
# both times and the ratio. Only the suite syncs what it fetched (each
# group of messages, before their DELEs); fetchmail's file is never synced.
#   bench/pop_client.sh [path to a velmor built without sanitizers]
# POP_CLIENT_BENCH_MESSAGES and POP_CLIENT_BENCH_ROUNDS change the size and
# the rounds (best of 3 by default).
set -e
cd "$(dirname "$0")/.."
. bench/quiet_install.sh
use_velmor "$1"
need_dovecot pop3
command -v fetchmail >/dev/null 2>&1 || quiet_install fetchmail
exec python3 bench/pop_client_bench.py

#!/bin/sh
# POP3 read benchmark: a 5,000-message mailbox read with LIST, UIDL and RETR
# of every message, from Velmor and from Dovecot's POP3 server (Debian's
# package), both on loopback over the same messages.
#   bench/pop3.sh [path to a velmor built without sanitizers]
# POP3_BENCH_MESSAGES and POP3_BENCH_ROUNDS change the size and the rounds.
set -e
cd "$(dirname "$0")/.."
if [ -n "$1" ]; then
  export VELMOR_BIN="$1"
  export VELMORCTL_BIN="$(dirname "$1")/velmorctl"
fi
. bench/quiet_install.sh
if ! command -v dovecot >/dev/null 2>&1 || [ ! -x /usr/lib/dovecot/pop3 ]; then
  quiet_install dovecot-pop3d
fi
exec python3 bench/pop3_bench.py

#!/bin/sh
# IMAP read benchmark: a 5,000-message mailbox (the POP3 benchmark's, some
# of them multipart) read with SELECT, one FETCH of every message's flags,
# envelope, structure and size, BODY.PEEK[] of each, and a header-word and
# a SINCE UID SEARCH, from Velmor and from Dovecot's IMAP server (Debian's
# package), both on loopback over the same messages.
#   bench/imap.sh [path to a velmor built without sanitizers]
# IMAP_BENCH_MESSAGES and IMAP_BENCH_ROUNDS change the size and the rounds.
set -e
cd "$(dirname "$0")/.."
. bench/quiet_install.sh
use_velmor "$1"
need_dovecot imap
exec python3 bench/imap_bench.py

#!/bin/sh
# TLS benchmark: handshakes a second on POP3 over TLS, then the POP3 and
# IMAP read benchmarks' 5,000-message mailbox over TLS from the first byte,
# from Velmor and from Dovecot (Debian's packages) on the same certificate.
#   bench/tls.sh [path to a velmor built without sanitizers]
# TLS_BENCH_HANDSHAKES and POP3_BENCH_MESSAGES change the sizes.
set -e
cd "$(dirname "$0")/.."
. bench/quiet_install.sh
use_velmor "$1"
need_dovecot pop3
need_dovecot imap
exec python3 bench/tls_bench.py

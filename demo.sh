#!/bin/sh
# Builds an optimised Velmor, makes the default installation in ./demo (once)
# and runs the suite on it, listening on 127.0.0.1 only. Ctrl-C stops it.
set -eu
cd "$(dirname "$0")"
. ./scripts/deps.sh
velmor_install_deps

cmake -S . -B build-release -G Ninja -DCMAKE_BUILD_TYPE=Release -DVELMOR_TESTS=OFF >/dev/null
ninja -C build-release -j"${VELMOR_JOBS:-$(nproc)}"

root="$PWD/demo"
if [ ! -f "$root/config/master" ]; then
  # The demo user's random password is shown once by --init; keep it (private)
  # so that every run can show it again.
  init_out=$(./build-release/velmor --root "$root" --init)
  echo "$init_out"
  (umask 077; echo "$init_out" | grep '^Demo login' > "$root/demo-login" || true)
fi
if [ -f "$root/run/velmor.pid" ] && ! kill -0 "$(cat "$root/run/velmor.pid")" 2>/dev/null; then
  echo "Removing the pid file of a suite that is no longer running"
  rm -f "$root/run/velmor.pid"
fi

./build-release/velmor --root "$root" --bind 127.0.0.1 &
pid=$!
trap 'kill -TERM $pid 2>/dev/null' INT TERM
for _ in $(seq 100); do
  [ -f "$root/run/velmor.pid" ] || ! kill -0 $pid 2>/dev/null && break
  sleep 0.1
done

# Every service that is switched on in the configuration and accepts a
# connection now.
python3 - "$root/config/master" <<'PY'
import re, socket, sys
names = {'smtp': 'SMTP', 'pop': 'POP3', 'imap': 'IMAP', 'nntp': 'NNTP', 'web': 'Web server',
         'proxy.http': 'HTTP proxy', 'proxy.ftp': 'FTP proxy', 'proxy.telnet': 'Telnet proxy',
         'proxy.socks': 'SOCKS proxy', 'proxy.raudio': 'Audio relay'}
keys = {}
for line in open(sys.argv[1], errors='replace'):
    m = re.match(r'%([^:]+):\s*(.*)', line)
    if m:
        keys[m.group(1).strip().lower()] = m.group(2).strip()
print('\nVelmor is running. Listening on 127.0.0.1:')
for key, label in names.items():
    port = keys.get(key + '.sock.port')
    if not port:
        continue
    try:
        socket.create_connection(('127.0.0.1', int(port)), timeout=1).close()
    except OSError:
        continue
    print('  %-13s port %s' % (label, port))
print('Logs are in demo/logs; Ctrl-C stops the suite.\n')
PY
[ -s "$root/demo-login" ] && cat "$root/demo-login" && echo
wait $pid || true
wait $pid 2>/dev/null || true

#!/bin/sh
# Builds an optimised Velmor, makes the default installation in ./demo (once)
# and runs the suite on it, listening on 127.0.0.1 only. Ctrl-C stops it.
set -eu
cd "$(dirname "$0")"
. ./scripts/deps.sh
velmor_install_deps

cmake -S . -B build-release -G Ninja -DCMAKE_BUILD_TYPE=Release -DVELMOR_TESTS=OFF >/dev/null
ninja -C build-release -j"${VELMOR_JOBS:-$(nproc)}"

bin="$PWD/build-release"
root="$PWD/demo"
if [ ! -f "$root/config/master" ]; then
  # Prints the demo user's random password, which it also keeps (private)
  # in demo/demo-login; `velmor --root demo --passwd demo` keeps that current.
  "$bin/velmor" --root "$root" --init
fi

mkdir -p "$root/logs"
console="$root/logs/console"
"$bin/velmor" --root "$root" --bind 127.0.0.1 >"$console" 2>&1 &
pid=$!
trap 'kill -TERM $pid 2>/dev/null' INT TERM

# Up once its pid file names this process and its control channel answers;
# a suite that ended has said why on its console.
up=no
for _ in $(seq 150); do
  kill -0 $pid 2>/dev/null || break
  if [ "$(cat "$root/run/velmor.pid" 2>/dev/null)" = "$pid" ] &&
     "$bin/velmorctl" --root "$root" test >/dev/null 2>&1; then
    up=yes
    break
  fi
  sleep 0.1
done
if [ "$up" = no ]; then
  cat "$console"
  echo "The suite did not start; its output is above (and in demo/logs/console)."
  kill -TERM $pid 2>/dev/null || true
  wait $pid 2>/dev/null || true
  exit 1
fi

# Each service the suite says it listens on, checked: the listening socket
# on that port must be one of this process's own descriptors.
if ! python3 - "$console" "$pid" <<'PY'
import os, re, sys
console, pid = sys.argv[1], sys.argv[2]
ours = set()
for fd in os.listdir('/proc/%s/fd' % pid):
    try:
        m = re.match(r'socket:\[(\d+)\]$', os.readlink('/proc/%s/fd/%s' % (pid, fd)))
    except OSError:
        continue
    if m:
        ours.add(m.group(1))
listening = {}  # port -> inodes of the TCP sockets listening on it
with open('/proc/net/tcp') as f:
    next(f)
    for line in f:
        fields = line.split()
        if fields[3] == '0A':
            listening.setdefault(int(fields[1].split(':')[1], 16), set()).add(fields[9])
with open(console) as f:
    lines = [line.rstrip('\n') for line in f]
bad = 0
print('\nVelmor is running (process %s). Listening:' % pid)
for line in lines:
    m = re.match(r'Listening for (.+) on ([\d.]+):(\d+)$', line)
    if not m:
        continue
    port = int(m.group(3))
    held = bool(listening.get(port, set()) & ours)
    bad += not held
    print('  %-12s %s:%d%s' % (m.group(1), m.group(2), port, '' if held else '  NOT held by the suite!'))
for line in lines:
    if line.startswith(('Cannot listen', 'Not listening', 'Replaced the pid file')):
        print('  ' + line)
sys.exit(1 if bad else 0)
PY
then
  echo "Another program holds a port the suite named; stopping it."
  kill -TERM $pid 2>/dev/null || true
  wait $pid 2>/dev/null || true
  exit 1
fi

[ -s "$root/demo-login" ] && cat "$root/demo-login"
cat <<EOF
Logs are in demo/logs (main, mail, errors; the console in console).
Try: build-release/velmorctl --root demo status      (build-release/velmorctl help lists the rest)
Ctrl-C stops the suite.
EOF
wait $pid || true
wait $pid 2>/dev/null || true

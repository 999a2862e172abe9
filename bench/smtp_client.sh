#!/bin/sh
# Sending the outgoing queue: the suite's SMTP client empties COUNT queued
# messages of SIZE bytes into Postfix's smtp-sink over one connection, and
# Postfix's smtp-source sends as many messages of the same size over one
# session to the same sink. smtp-source reads no queue and deletes nothing,
# so its time is a ceiling; the suite reads, checks and deletes every file.
# Prints both times and the ratio.
#
#   bench/smtp_client.sh            COUNT=2000 SIZE=4096 ROUNDS=3 by default (best of the rounds)
set -eu

COUNT=${COUNT:-2000}
SIZE=${SIZE:-4096}
ROUNDS=${ROUNDS:-3}
HERE=$(cd "$(dirname "$0")/.." && pwd)
BUILD=${BUILD:-$HERE/build-bench}
SINK_ADDR=${SINK_ADDR:-127.53.251.25}
NS_ADDR=${NS_ADDR:-127.53.251.53}

SUDO=
[ "$(id -u)" -eq 0 ] || SUDO=sudo
SINK=$(command -v smtp-sink || echo /usr/sbin/smtp-sink)
SOURCE=$(command -v smtp-source || echo /usr/sbin/smtp-source)
[ -x "$SINK" ] && [ -x "$SOURCE" ] || { echo "needs Postfix's smtp-sink and smtp-source (package postfix)"; exit 1; }

cmake -S "$HERE" -B "$BUILD" -G Ninja -DCMAKE_BUILD_TYPE=Release -DVELMOR_TESTS=OFF >/dev/null
ninja -C "$BUILD" -j2 velmor velmorctl >/dev/null
VELMOR="$BUILD/velmor"
CTL="$BUILD/velmorctl"

WORK=$(mktemp -d "${TMPDIR:-/tmp}/velmor-smtpc-bench.XXXXXX")
VPID= SPID= NPID=
cleanup() {
  for pid in $VPID $SPID $NPID; do kill "$pid" 2>/dev/null || true; done
  wait 2>/dev/null || true
  rm -rf "$WORK"
}
trap cleanup EXIT INT TERM

# The link counts as up once a name server answers: one that says "no such
# name" to everything will do (the relay host is an address).
python3 - "$NS_ADDR" "$HERE/tests" <<'PY' &
import sys, time
sys.path.insert(0, sys.argv[2])
from dns_server import NameServer, response
NameServer(sys.argv[1], lambda q: [(response(q, rcode=3), None)])
while True:
    time.sleep(3600)
PY
NPID=$!

$SUDO "$SINK" -u nobody "$SINK_ADDR:25" 100 &
SPID=$!
python3 - "$SINK_ADDR" <<'PY'
import socket, sys, time
deadline = time.time() + 20
while time.time() < deadline:
    try:
        socket.create_connection((sys.argv[1], 25), timeout=1).close()
        sys.exit(0)
    except OSError:
        time.sleep(0.1)
sys.exit("smtp-sink did not come up")
PY

# ---- the suite ----------------------------------------------------------------------
VROOT="$WORK/velmor"
"$VELMOR" --root "$VROOT" --init >/dev/null
python3 - "$VROOT" "$COUNT" "$SIZE" "$NS_ADDR" "$SINK_ADDR" <<'PY'
import os, re, socket, sys
root, count, size, ns, sink = sys.argv[1], int(sys.argv[2]), int(sys.argv[3]), sys.argv[4], sys.argv[5]
master = os.path.join(root, 'config/master')
keys = {'dns.servers': ns, 'dns.timeout': '1', 'smtp.hosts': sink, 'smtp.time': '0'}
with open(master) as f:
    lines = f.read().split('\n')
def port():
    s = socket.socket(); s.bind(('127.0.0.1', 0)); p = s.getsockname()[1]; s.close(); return str(p)
out = []
for line in lines:
    m = re.match(r'%([a-z.]+):', line)
    if m and m.group(1) in keys:
        line = '%%%s: %s' % (m.group(1), keys.pop(m.group(1)))
    elif m and m.group(1).endswith('.sock.port'):
        line = '%%%s: %s' % (m.group(1), port())
    out.append(line)
out += ['%%%s: %s' % kv for kv in keys.items()]
with open(master, 'w') as f:
    f.write('\n'.join(out))
PY
# Fills the outgoing queue with COUNT messages of SIZE bytes.
fill_queue() {
  python3 - "$VROOT/mail/out" "$COUNT" "$SIZE" <<'PY'
import os, sys
outdir, count, size = sys.argv[1], int(sys.argv[2]), int(sys.argv[3])
body = ('Subject: bench\r\n\r\n' + ('x' * 76 + '\r\n') * (size // 78)).encode()
os.makedirs(outdir, exist_ok=True)
for i in range(count):
    with open(os.path.join(outdir, str(1000000 + i)), 'wb') as f:
        f.write(b'MAIL FROM:<bench@client.example>\r\nRCPT TO:<rcpt@remote.example>\r\nDATA\r\n' + body + b'.\r\n')
PY
}
seconds() { python3 -c "import sys; print('%.3f' % (float(sys.argv[2]) - float(sys.argv[1])))" "$1" "$2"; }
best() { printf '%s\n' "$@" | sort -n | head -1; }
"$VELMOR" --root "$VROOT" --bind 127.0.0.1 >/dev/null 2>&1 &
VPID=$!
python3 - "$CTL" "$VROOT" <<'PY'
import subprocess, sys, time
deadline = time.time() + 30
while time.time() < deadline:
    r = subprocess.run([sys.argv[1], '--root', sys.argv[2], 'status'], capture_output=True, text=True)
    if r.returncode == 0 and r.stdout.startswith('is:') and int(r.stdout.split('\n')[0][3:]) & 0x10000:
        sys.exit(0)
    time.sleep(0.1)
sys.exit("the suite did not see the link come up")
PY

# Each side runs ROUNDS times; the best time counts (a busy machine only
# ever makes a run slower).
SUITE_TIMES= SOURCE_TIMES=
round=0
while [ "$round" -lt "$ROUNDS" ]; do
  round=$((round + 1))
  fill_queue
  "$CTL" --root "$VROOT" mailrescan >/dev/null
  start=$(date +%s.%N)
  "$CTL" --root "$VROOT" smtpkick >/dev/null
  python3 - "$VROOT/mail/out" <<'PY'
import os, sys, time
deadline = time.time() + 600
while os.listdir(sys.argv[1]):
    if time.time() > deadline:
        sys.exit("the queue did not empty")
    time.sleep(0.005)
PY
  end=$(date +%s.%N)
  SUITE_TIMES="$SUITE_TIMES $(seconds "$start" "$end")"

  start=$(date +%s.%N)
  "$SOURCE" -s 1 -d -m "$COUNT" -l "$SIZE" -f bench@client.example -t rcpt@remote.example \
    -M client.example "$SINK_ADDR:25" >/dev/null
  end=$(date +%s.%N)
  SOURCE_TIMES="$SOURCE_TIMES $(seconds "$start" "$end")"
done
# shellcheck disable=SC2086
SUITE=$(best $SUITE_TIMES)
# shellcheck disable=SC2086
SOURCE_TIME=$(best $SOURCE_TIMES)

echo "$COUNT messages of $SIZE bytes into smtp-sink over one connection, best of $ROUNDS"
echo "velmor SMTP client (reads, checks and deletes each queue file): ${SUITE} s"
echo "smtp-source (no queue; the ceiling):                          ${SOURCE_TIME} s"
python3 -c "import sys; print('ratio velmor/smtp-source: %.2f' % (float(sys.argv[1]) / float(sys.argv[2])))" \
  "$SUITE" "$SOURCE_TIME"

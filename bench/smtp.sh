#!/bin/sh
# Mail intake throughput: Postfix's smtp-source hands the same number of
# messages, of the same size, over the same number of parallel sessions, to
# Velmor and to a private Postfix instance on another loopback port. Both
# queue every message durably (synced to disk) before they acknowledge it;
# Postfix then delivers to its discard transport, Velmor leaves the queue for
# its debatch. Prints messages per second for each and the ratio.
#
#   bench/smtp.sh            COUNT=2000 SIZE=4096 SESSIONS=10 by default
set -eu

COUNT=${COUNT:-2000}
SIZE=${SIZE:-4096}
SESSIONS=${SESSIONS:-10}
HERE=$(cd "$(dirname "$0")/.." && pwd)
BUILD=${BUILD:-$HERE/build-bench}

SUDO=
[ "$(id -u)" -eq 0 ] || SUDO=sudo

# ---- tools: Postfix (for smtp-source and the comparison server) -----------
if ! command -v smtp-source >/dev/null 2>&1 && [ ! -x /usr/sbin/smtp-source ] || [ ! -x /usr/sbin/postfix ]; then
  # Install without letting the package start a system mail service.
  made_policy=
  if [ ! -e /usr/sbin/policy-rc.d ]; then
    printf '#!/bin/sh\nexit 101\n' | $SUDO tee /usr/sbin/policy-rc.d >/dev/null
    $SUDO chmod 755 /usr/sbin/policy-rc.d
    made_policy=1
  fi
  echo "postfix postfix/main_mailer_type select No configuration" | $SUDO debconf-set-selections
  $SUDO env DEBIAN_FRONTEND=noninteractive apt-get install -y -qq postfix >/dev/null
  [ -z "$made_policy" ] || $SUDO rm -f /usr/sbin/policy-rc.d
fi
SOURCE=$(command -v smtp-source || echo /usr/sbin/smtp-source)

# ---- the optimised daemon ------------------------------------------------------
cmake -S "$HERE" -B "$BUILD" -G Ninja -DCMAKE_BUILD_TYPE=Release -DVELMOR_TESTS=OFF >/dev/null
ninja -C "$BUILD" -j2 velmor >/dev/null
VELMOR="$BUILD/velmor"

WORK=$(mktemp -d "${TMPDIR:-/tmp}/velmor-smtp-bench.XXXXXX")
VPID=
PF_CONF="$WORK/postfix/etc"
cleanup() {
  [ -z "$VPID" ] || kill "$VPID" 2>/dev/null || true
  [ ! -f "$PF_CONF/main.cf" ] || $SUDO postfix -c "$PF_CONF" stop >/dev/null 2>&1 || true
  sleep 1
  $SUDO rm -rf "$WORK"
}
trap cleanup EXIT INT TERM

free_port() {
  python3 -c 'import socket; s=socket.socket(); s.bind(("127.0.0.1",0)); print(s.getsockname()[1])'
}
wait_port() {
  python3 - "$1" <<'PY'
import socket, sys, time
deadline = time.time() + 20
while time.time() < deadline:
    try:
        socket.create_connection(("127.0.0.1", int(sys.argv[1])), timeout=1).close()
        sys.exit(0)
    except OSError:
        time.sleep(0.1)
sys.exit("server on port %s did not come up" % sys.argv[1])
PY
}
# Runs smtp-source against a port; prints messages per second.
measure() {
  start=$(date +%s.%N)
  "$SOURCE" -s "$SESSIONS" -m "$COUNT" -l "$SIZE" -f bench@client.example -t rcpt@remote.example \
    -M client.example "127.0.0.1:$1" >/dev/null
  end=$(date +%s.%N)
  python3 -c "import sys; print('%.1f' % ($COUNT / (float(sys.argv[2]) - float(sys.argv[1]))))" "$start" "$end"
}

# ---- Velmor ------------------------------------------------------------------------
VPORT=$(free_port)
VROOT="$WORK/velmor"
"$VELMOR" --root "$VROOT" --init >/dev/null
cat >>"$VROOT/config/master" <<EOT
%smtp.sock.port: $VPORT
%smtp.sock.max: $((SESSIONS + 10))
%mail.debatch.time: 0
EOT
"$VELMOR" --root "$VROOT" --bind 127.0.0.1 >"$WORK/velmor.out" 2>&1 &
VPID=$!
wait_port "$VPORT"
velmor_rate=$(measure "$VPORT")
queued=$(find "$VROOT/mail/in" -type f -name '[0-9]*' | wc -l)
kill "$VPID"
wait "$VPID" 2>/dev/null || true
VPID=

# ---- Postfix, a private instance ---------------------------------------------------
PPORT=$(free_port)
PF="$WORK/postfix"
mkdir -p "$PF_CONF" "$PF/queue" "$PF/data"
chmod 755 "$WORK" "$PF"  # Postfix's own processes run as its user
$SUDO chown postfix "$PF/data"
cat >"$PF_CONF/main.cf" <<EOT
compatibility_level = 3.6
queue_directory = $PF/queue
data_directory = $PF/data
mail_owner = postfix
setgid_group = postdrop
myhostname = bench.localdomain
mydestination =
inet_interfaces = 127.0.0.1
inet_protocols = ipv4
mynetworks = 127.0.0.0/8
relay_domains =
smtpd_relay_restrictions = permit_mynetworks, reject
smtpd_recipient_restrictions = permit_mynetworks, reject
default_transport = discard
local_transport = discard
relay_transport = discard
maillog_file = $PF/maillog
maillog_file_prefixes = $PF
default_process_limit = $((SESSIONS + 20))
smtpd_client_connection_rate_limit = 0
EOT
# Debian's service table, with smtpd on our port and no chroot.
awk -v port="$PPORT" '
  /^smtp[ \t]+inet/ { print "127.0.0.1:" port " inet n - n - - smtpd"; next }
  /^#/ || NF == 0 { print; next }
  NF >= 8 && $2 ~ /^(unix|inet|fifo|pass|unix-dgram)$/ { $5 = "n" }
  { print }' /etc/postfix/master.cf >"$PF_CONF/master.cf"
$SUDO postfix -c "$PF_CONF" set-permissions >/dev/null 2>&1 || true
$SUDO postfix -c "$PF_CONF" start >/dev/null 2>&1
wait_port "$PPORT"
postfix_rate=$(measure "$PPORT")

echo "smtp-source: $COUNT messages of $SIZE bytes over $SESSIONS sessions"
echo "velmor:  $velmor_rate messages/s ($queued queue files)"
echo "postfix: $postfix_rate messages/s"
python3 -c "import sys; print('ratio velmor/postfix: %.2f' % (float(sys.argv[1]) / float(sys.argv[2])))" \
  "$velmor_rate" "$postfix_rate"

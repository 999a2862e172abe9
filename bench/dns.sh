#!/bin/sh
# Name lookups per second: unbound (Debian) answers COUNT names from a static
# local zone on a loopback address of its own (no recursion). The suite's
# resolver (dns/ and the dispatcher, cache empty) resolves them all with
# OUTSTANDING lookups in flight; dnsperf sends the same names to the same
# unbound with the same number outstanding. Prints lookups per second for
# each, their ratio, and the suite's cached lookups per second.
#
#   bench/dns.sh             COUNT=20000 OUTSTANDING=100 ADDRESS=127.54.0.1
set -eu
cd "$(dirname "$0")/.."
COUNT=${COUNT:-20000}
OUTSTANDING=${OUTSTANDING:-100}
ADDRESS=${ADDRESS:-127.54.0.1}

. ./scripts/deps.sh
VELMOR_PACKAGES="$VELMOR_PACKAGES libbenchmark-dev unbound dnsperf"
# The package must not start a system resolver (on 127.0.0.1:53, and through
# resolvconf into the machine's own resolv.conf): only ours below runs.
made_policy=
if [ ! -e /usr/sbin/policy-rc.d ] && ! command -v unbound >/dev/null 2>&1; then
  sudo=""
  [ "$(id -u)" -eq 0 ] || sudo="sudo"
  printf '#!/bin/sh\nexit 101\n' | $sudo tee /usr/sbin/policy-rc.d >/dev/null
  $sudo chmod 755 /usr/sbin/policy-rc.d
  made_policy=1
fi
velmor_install_deps
[ -z "$made_policy" ] || $sudo rm -f /usr/sbin/policy-rc.d

cmake -S . -B build-bench -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo -DVELMOR_SANITIZE=OFF \
  -DVELMOR_FUZZ=OFF -DVELMOR_TESTS=OFF -DVELMOR_BENCH=ON >/dev/null
ninja -C build-bench -j"${VELMOR_JOBS:-2}" dns_bench | grep -v "^\[" || true
test -x build-bench/bench/dns_bench

work=$(mktemp -d /tmp/velmor-dns-bench.XXXXXX)
unbound_pid=
cleanup() {
  [ -n "$unbound_pid" ] && kill "$unbound_pid" 2>/dev/null && wait "$unbound_pid" 2>/dev/null
  rm -rf "$work"
}
trap cleanup EXIT INT TERM

# The zone and the query file: nNNNNN.bench. -> 10.x.y.z
python3 - "$COUNT" "$work" <<'PY'
import sys
count, work = int(sys.argv[1]), sys.argv[2]
with open(work + '/zone.conf', 'w') as zone, open(work + '/names', 'w') as names:
    zone.write('server:\n  local-zone: "bench." static\n')
    for i in range(count):
        name = 'n%06d.bench' % i
        zone.write('  local-data: "%s. 3600 IN A 10.%d.%d.%d"\n' % (name, i >> 16 & 255, i >> 8 & 255, i & 255))
        names.write('%s A\n' % name)
PY
cat > "$work/unbound.conf" <<CONF
server:
  interface: $ADDRESS
  port: 53
  do-ip6: no
  do-tcp: no
  access-control: 127.0.0.0/8 allow
  num-threads: 1
  do-daemonize: no
  chroot: ""
  username: ""
  directory: "$work"
  pidfile: "$work/unbound.pid"
  use-syslog: no
  logfile: ""
  verbosity: 0
  so-reuseport: no
include: "$work/zone.conf"
remote-control:
  control-enable: no
CONF
unbound -d -c "$work/unbound.conf" &
unbound_pid=$!
tries=0
until dig @"$ADDRESS" +short +time=1 +tries=1 n000000.bench A 2>/dev/null | grep -q '^10\.'; do
  tries=$((tries + 1))
  [ $tries -lt 50 ] || { echo "unbound did not start" >&2; exit 1; }
  sleep 0.2
done

echo "== the suite's resolver: $COUNT names, $OUTSTANDING outstanding =="
ours=$(build-bench/bench/dns_bench "$ADDRESS" "$work/names" "$OUTSTANDING") || { echo "$ours"; exit 1; }
echo "$ours"
echo "== dnsperf: the same names, $OUTSTANDING outstanding =="
theirs=$(dnsperf -s "$ADDRESS" -p 53 -d "$work/names" -q "$OUTSTANDING" -n 1 -t 5 2>&1)
echo "$theirs" | grep -E 'Queries (sent|completed|lost)|Queries per second|Run time'
python3 - "$ours" "$theirs" <<'PY'
import re, sys
ours, theirs = sys.argv[1], sys.argv[2]
cold = float(re.search(r'cold: .* ([\d.]+) lookups/s', ours).group(1))
cached = float(re.search(r'cached: .* ([\d.]+) lookups/s', ours).group(1))
qps = float(re.search(r'Queries per second:\s+([\d.]+)', theirs).group(1))
print('suite cold lookups/s:   %.0f' % cold)
print('dnsperf queries/s:      %.0f' % qps)
print('ratio suite/dnsperf:    %.2f' % (cold / qps))
print('suite cached lookups/s: %.0f' % cached)
PY

#!/usr/bin/env python3
"""What idle connections cost the suite.

Holds N idle connections to a listening service of a private suite and
measures, at N = 10 and N = 2,000:
  - the round trip of a "test" request on the control channel (median and
    99th percentile of 500 requests), and
  - the suite's CPU time over a fixed idle interval (from /proc/<pid>/stat).
Prints both and the ratio of the 2,000 figures to the 10 figures.

    VELMOR_BIN=build-release/velmor VELMORCTL_BIN=build-release/velmorctl \\
        python3 bench/control_idle.py [--interval SECONDS]

The idle connections go to the first service that has a listener (SMTP,
POP3, IMAP, NNTP or the web server, in that order).
"""

import argparse
import gc
import os
import resource
import socket
import statistics
import sys
import time

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), '..', 'tests'))
from harness import Suite  # noqa: E402

SERVICES = ('smtp', 'pop', 'imap', 'nntp', 'web')
TICKS = os.sysconf('SC_CLK_TCK')


def cpu_seconds(pid):
    with open('/proc/%d/stat' % pid) as f:
        fields = f.read().rsplit(')', 1)[1].split()
    return (int(fields[11]) + int(fields[12])) / TICKS  # utime + stime


def round_trips(control, count):
    s = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
    s.bind('')
    s.settimeout(3)
    times = []
    # The collector would walk every held connection object in the middle
    # of a measurement.
    gc.collect()
    gc.disable()
    for _ in range(count):
        t = time.perf_counter()
        s.sendto(b'test', control)
        s.recv(256)
        times.append(time.perf_counter() - t)
    gc.enable()
    s.close()
    times.sort()
    return statistics.median(times), times[int(len(times) * 0.99) - 1]


def hold(port, n):
    conns = []
    for _ in range(n):
        c = socket.create_connection(('127.0.0.1', port), timeout=5)
        conns.append(c)
    return conns


def listening(port):
    try:
        socket.create_connection(('127.0.0.1', port), timeout=1).close()
        return True
    except OSError:
        return False


def main():
    ap = argparse.ArgumentParser()
    ap.add_argument('--interval', type=float, default=10.0, help='idle interval for the CPU figure')
    args = ap.parse_args()

    soft, hard = resource.getrlimit(resource.RLIMIT_NOFILE)
    resource.setrlimit(resource.RLIMIT_NOFILE, (max(soft, min(hard, 8192)), hard))
    overrides = {}
    for name in SERVICES:
        overrides['%s.sock.max' % name] = '3000'
        overrides['%s.sock.timeout' % name] = '3600'
    suite = Suite(config=overrides)
    try:
        suite.start()
        service = next((n for n in SERVICES if n in suite.ports and listening(suite.port(n))), None)
        if service is None:
            print('no service listens yet: nothing to hold connections to')
            return 1
        control = suite.path('run/control')
        results = {}
        for n in (10, 2000):
            conns = hold(suite.port(service), n)
            time.sleep(1.0)  # let the suite accept and greet them all
            median, p99 = round_trips(control, 500)
            before = cpu_seconds(suite.proc.pid)
            time.sleep(args.interval)
            cpu = cpu_seconds(suite.proc.pid) - before
            results[n] = (median, p99, cpu)
            print('N=%-5d %s: "test" round trip median %.1f us, p99 %.1f us; CPU %.3f s over %.0f s idle'
                  % (n, service, median * 1e6, p99 * 1e6, cpu, args.interval))
            for c in conns:
                c.close()
            time.sleep(1.0)
        (m10, p10, c10), (m2k, p2k, c2k) = results[10], results[2000]
        print('ratio N=2000 / N=10: round trip median %.2fx, p99 %.2fx; CPU %s'
              % (m2k / m10, p2k / p10, ('%.2fx' % (c2k / c10)) if c10 > 0 else
                 '%.3f s vs %.3f s (below the clock tick at N=10)' % (c2k, c10)))
        return 0
    finally:
        suite.stop()
        suite.cleanup()


if __name__ == '__main__':
    sys.exit(main())

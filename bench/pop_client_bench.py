"""Collects one 5,000-message mailbox from a private Dovecot with the
suite's POP3 client and with fetchmail (--bsmtp into one file), both
deleting on the server, the mailbox restored before each run; prints the
best time of each and their ratio.

Run through bench/pop_client.sh, which installs Dovecot and fetchmail when
they are missing."""

import os
import shutil
import subprocess
import sys
import tempfile
import time

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(os.path.dirname(HERE), 'tests'))
sys.path.insert(0, HERE)
import dovecot  # noqa: E402
import pop3_bench  # noqa: E402
from dns_server import NameServer, response, test_address  # noqa: E402
from harness import Suite  # noqa: E402

MESSAGES = int(os.environ.get('POP_CLIENT_BENCH_MESSAGES', '5000'))
ROUNDS = int(os.environ.get('POP_CLIENT_BENCH_ROUNDS', '3'))


def make_messages(count):
    """The POP3 benchmark's messages (about 1 to 12 KB), LF line ends."""
    return [('\n'.join(lines) + '\n').encode() for lines in pop3_bench.make_messages(count)]


def wait(predicate, timeout=600, poll=0.01):
    deadline = time.monotonic() + timeout
    while not predicate():
        if time.monotonic() > deadline:
            raise RuntimeError('timed out')
        time.sleep(poll)


def run_velmor(server, messages):
    names = NameServer(test_address(60), lambda q: [(response(q, rcode=3), None)])
    suite = Suite(config={'dns.servers': names.address, 'mail.debatch.time': '0',
                          'pop.hosts': 'bench:%s@127.0.0.1:%d' % (server.password, server.port)})
    try:
        suite.start()
        wait(lambda: int(suite.ctl('status')[1].split('\n')[0][3:]) & 0x10000, 30)  # the link is up
        incoming = suite.path('mail/in')
        times = []
        for _ in range(ROUNDS):
            server.fill('bench', messages)
            for name in os.listdir(incoming):
                os.unlink(os.path.join(incoming, name))
            start = time.perf_counter()
            suite.ctl('popkick')
            # Done when the server has applied the deletions: at QUIT, which
            # follows the last DELE, which follows the last message's commit
            # (its sync and rename). Polled gently: listing thousands of
            # names competes with what is measured.
            wait(lambda: server.left('bench') == 0, poll=0.05)
            times.append(time.perf_counter() - start)
            queued = sum(1 for n in os.listdir(incoming) if n.isdigit())
            if queued != len(messages):
                raise RuntimeError('velmor queued %d messages, not %d' % (queued, len(messages)))
        return times
    finally:
        suite.stop()
        suite.cleanup()
        names.close()


def run_fetchmail(server, messages):
    work = tempfile.mkdtemp(prefix='velmor-bench-fetchmail-')
    try:
        rc = os.path.join(work, 'fetchmailrc')
        with open(rc, 'w') as f:
            f.write('set no syslog\nset no bouncemail\n'
                    'poll 127.0.0.1 protocol POP3 port %d timeout 60\n'
                    '  user "bench" password "%s" is root here fetchall no keep\n'
                    '  sslproto "" no sslcertck\n' % (server.port, server.password))
        os.chmod(rc, 0o600)
        env = dict(os.environ, HOME=work, FETCHMAILHOME=work)
        times = []
        for _ in range(ROUNDS):
            server.fill('bench', messages)
            out = os.path.join(work, 'bsmtp')
            if os.path.exists(out):
                os.unlink(out)
            start = time.perf_counter()
            r = subprocess.run(['fetchmail', '-f', rc, '--nodetach', '--bsmtp', out, '--pidfile',
                                os.path.join(work, 'pid')], capture_output=True, env=env, stdin=subprocess.DEVNULL,
                               timeout=600)
            times.append(time.perf_counter() - start)
            if r.returncode != 0 or server.left('bench') != 0:
                raise RuntimeError('fetchmail failed (%d):\n%s' % (r.returncode, r.stderr.decode(errors='replace')))
            with open(out, 'rb') as f:
                got = sum(1 for line in f.read().splitlines() if line.rstrip(b'\r') == b'DATA')
            if got != len(messages):
                raise RuntimeError('fetchmail wrote %d messages, not %d' % (got, len(messages)))
        return times
    finally:
        shutil.rmtree(work, ignore_errors=True)


def report(label, times):
    print('%-9s %d messages: best %.3f s of %s' % (label, MESSAGES, min(times), ', '.join('%.3f' % t for t in times)))
    return min(times)


def main():
    messages = make_messages(MESSAGES)
    server = dovecot.Dovecot()
    try:
        ours = report('velmor', run_velmor(server, messages))
        theirs = report('fetchmail', run_fetchmail(server, messages))
    finally:
        server.close()
    print('velmor %.3f s, fetchmail %.3f s: velmor takes %.2fx the time of fetchmail' % (ours, theirs, ours / theirs))
    print('(velmor syncs each group of fetched messages before their DELEs; fetchmail --bsmtp never syncs its file)')


if __name__ == '__main__':
    main()

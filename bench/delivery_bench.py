"""Local delivery into a big mailbox, and what a burst costs the other
clients.

1. Deliveries per second into one mailbox that already holds 0, 10,000 and
   50,000 messages of 4 KB: Velmor (queue files debatched into its mailbox)
   beside Dovecot's local delivery agent (dovecot-lda, one process per
   message, as a mail server runs it) into a private mbox and a private
   Maildir, all on the same messages. The figure should stay flat.
2. The largest delay of an SMTP greeting while Velmor delivers a burst of
   10,000 messages to one user (a client connects every 10 ms).

Each figure is the best of ROUNDS runs (other work shares the machine).
Run through bench/delivery.sh, which builds an optimised daemon and installs
Dovecot when it is missing."""

import os
import shutil
import socket
import statistics
import subprocess
import sys
import tempfile
import time

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(os.path.dirname(HERE), 'tests'))
from harness import Suite, VELMOR_BIN  # noqa: E402

SIZES = [int(x) for x in os.environ.get('BENCH_SIZES', '0,10000,50000').split(',')]
VELMOR_COUNT = int(os.environ.get('BENCH_VELMOR_COUNT', '2000'))
LDA_COUNT = int(os.environ.get('BENCH_LDA_COUNT', '300'))
BURST = int(os.environ.get('BENCH_BURST', '10000'))
ROUNDS = int(os.environ.get('BENCH_ROUNDS', '3'))
LDA = '/usr/lib/dovecot/dovecot-lda'
DOMAIN = 'example.test'
NOBODY = 65534


def message(n):
    """A 4 KB message (header and body, LF line ends)."""
    head = ('From: Bob <bob@elsewhere.test>\nTo: alice@%s\nSubject: message %d\n'
            'Date: Tue, 14 Nov 2023 22:13:20 +0000\nMessage-ID: <%d.bench@elsewhere.test>\n\n' % (DOMAIN, n, n))
    line = 'the quick brown fox jumps over the lazy dog %d\n' % n
    return head + line * ((4096 - len(head)) // len(line))


def crlf(text):
    return text.replace('\n', '\r\n')


def queue_file(n):
    return ('MAIL FROM:<bob@elsewhere.test>\r\nRCPT TO:<alice@%s>\r\nDATA\r\n' % DOMAIN +
            crlf(message(n)) + '.\r\n').encode()


def velmor_mailbox(count):
    parts = []
    for n in range(count):
        text = crlf(message(n))
        head, _, body = text.partition('\r\n\r\n')
        parts.append('From bob@elsewhere.test Tue Nov 14 22:13:20 2023\r\n%s\r\nX-UID: %d\r\n\r\n%s.\r\n'
                     % (head, n + 1, body))
    return ''.join(parts).encode()


# ---- Velmor ----------------------------------------------------------------------

class VelmorBox:
    def __init__(self, held):
        self.suite = Suite(config={'mail.domains': DOMAIN, 'mail.debatch.time': '0'})
        self.home = self.suite.path('home/alice')
        Suite._run([VELMOR_BIN, '--root', self.suite.root, '--adduser', 'alice', '--password', 'x',
                    '--home', self.home])
        os.makedirs(os.path.join(self.home, 'mail'), exist_ok=True)
        with open(os.path.join(self.home, 'mail', 'inbox'), 'wb') as f:
            f.write(velmor_mailbox(held))
        self.incoming = self.suite.path('mail/in')
        self.next = 10 ** 9
        self.suite.start()
        self.deliver(1)  # the overview is built (or read) once, before the clock runs

    def queue(self, count):
        for _ in range(count):
            self.next += 1
            with open(os.path.join(self.incoming, str(self.next)), 'wb') as f:
                f.write(queue_file(self.next))

    def queued(self):
        return sum(1 for n in os.listdir(self.incoming) if n.isdigit())

    def deliver(self, count, probe=None):
        """Queues `count` messages, debatches them; seconds taken."""
        self.queue(count)
        self.suite.ctl('mailrescan')
        start = time.monotonic()
        self.suite.ctl('maildebatch')
        while self.queued():
            if probe:
                probe()
            time.sleep(0.002 if probe is None else 0.01)
            if time.monotonic() - start > 600:
                raise RuntimeError('delivery stalled: ' + self.suite.log('errors')[-1000:])
        return time.monotonic() - start

    def close(self):
        self.suite.stop()
        self.suite.cleanup()


def velmor_rate(held):
    box = VelmorBox(held)
    try:
        return max(VELMOR_COUNT / box.deliver(VELMOR_COUNT) for _ in range(ROUNDS))
    finally:
        box.close()


def greeting_delays():
    """The delays of SMTP greetings while a burst is delivered; (delays, rate)."""
    box = VelmorBox(0)
    port = box.suite.port('smtp')
    delays = []

    def probe():
        start = time.monotonic()
        with socket.create_connection(('127.0.0.1', port), timeout=10) as s:
            data = b''
            while b'\r\n' not in data:
                more = s.recv(512)
                if not more:
                    break
                data += more
        delays.append(time.monotonic() - start)

    try:
        took = box.deliver(BURST, probe)
        return delays, BURST / took
    finally:
        box.close()


# ---- Dovecot's local delivery agent --------------------------------------------------

class LdaBox:
    def __init__(self, held, fmt):
        self.work = tempfile.mkdtemp(prefix='velmor-lda-bench-')
        os.chmod(self.work, 0o755)
        self.home = os.path.join(self.work, 'home')
        for d in ('home', 'run', 'state'):
            os.makedirs(os.path.join(self.work, d))
        location = ('mbox:~/mail:INBOX=~/mail/inbox' if fmt == 'mbox' else 'maildir:~/Maildir')
        self.conf = os.path.join(self.work, 'dovecot.conf')
        with open(self.conf, 'w') as f:
            f.write('base_dir = %s/run\nstate_dir = %s/state\nlog_path = %s/state/lda.log\n'
                    'protocols =\nssl = no\nmail_location = %s\n' % (self.work, self.work, self.work, location))
        os.chmod(self.conf, 0o644)
        if fmt == 'mbox':
            os.makedirs(os.path.join(self.home, 'mail'))
            with open(os.path.join(self.home, 'mail', 'inbox'), 'w') as f:
                for n in range(held):
                    f.write('From bob@elsewhere.test Tue Nov 14 22:13:20 2023\n' + message(n) + '\n')
        else:
            for d in ('cur', 'new', 'tmp'):
                os.makedirs(os.path.join(self.home, 'Maildir', d))
            for n in range(held):
                with open(os.path.join(self.home, 'Maildir', 'cur', '%d.M%dP1.bench:2,' % (1700000000 + n, n)),
                          'w') as f:
                    f.write(message(n))
        for root, dirs, files in os.walk(self.work):
            for name in dirs + files:
                os.chown(os.path.join(root, name), NOBODY, NOBODY)
        self.next = 10 ** 9
        self.deliver(1)  # Dovecot indexes the mailbox before the clock runs

    def deliver(self, count):
        command = ['setpriv', '--reuid', str(NOBODY), '--regid', str(NOBODY), '--clear-groups', 'env',
                   'HOME=' + self.home, 'USER=alice', LDA, '-c', self.conf, '-f', 'bob@elsewhere.test']
        start = time.monotonic()
        for _ in range(count):
            self.next += 1
            subprocess.run(command, input=message(self.next).encode(), check=True)
        return time.monotonic() - start

    def close(self):
        shutil.rmtree(self.work, ignore_errors=True)


def lda_rate(held, fmt):
    box = LdaBox(held, fmt)
    try:
        return max(LDA_COUNT / box.deliver(LDA_COUNT) for _ in range(ROUNDS))
    finally:
        box.close()


def main():
    print('deliveries per second into a mailbox already holding N messages of 4 KB (best of %d runs;'
          ' velmor %d messages a run, dovecot-lda %d)' % (ROUNDS, VELMOR_COUNT, LDA_COUNT))
    print('%8s %12s %12s %12s %10s %10s' % ('N', 'velmor', 'lda mbox', 'lda maildir', 'v/mbox', 'v/maildir'))
    first = None
    for held in SIZES:
        v = velmor_rate(held)
        m = lda_rate(held, 'mbox')
        d = lda_rate(held, 'maildir')
        first = first or v
        print('%8d %12.0f %12.0f %12.0f %10.1f %10.1f' % (held, v, m, d, v / m, v / d))
        sys.stdout.flush()
    runs = [greeting_delays() for _ in range(ROUNDS)]
    best = min(runs, key=lambda r: max(r[0]))
    delays = sorted(best[0])
    print('SMTP greeting during a burst of %d messages to one user (best of %d runs): largest delay %.1f ms,'
          ' 99th percentile %.1f ms, median %.1f ms over %d connections; the burst went at %.0f deliveries/s'
          % (BURST, ROUNDS, 1000 * delays[-1], 1000 * delays[int(len(delays) * 0.99)],
             1000 * statistics.median(delays), len(delays), best[1]))


if __name__ == '__main__':
    main()

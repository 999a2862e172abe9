"""Reads one 5,000-message mailbox over POP3 (LIST, UIDL and RETR of every
message) from Velmor and from Dovecot's POP3 server, both on loopback over
the same messages, and prints both times and their ratio.

Run through bench/pop3.sh, which installs Dovecot when it is missing."""

import os
import random
import socket
import sys
import time

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(os.path.dirname(HERE), 'tests'))
import dovecot  # noqa: E402
from harness import Suite, VELMOR_BIN  # noqa: E402

MESSAGES = int(os.environ.get('POP3_BENCH_MESSAGES', '5000'))
ROUNDS = int(os.environ.get('POP3_BENCH_ROUNDS', '3'))
PASSWORD = 'bench-pass'
WORDS = ('mail suite local server message queue delivery mailbox overview index header body '
         'line dial link modem proxy cache news group article reader client').split()


def make_messages(count):
    """The messages as lists of lines (no line ends), sizes from 1 to ~12 KB."""
    rnd = random.Random(7)
    out = []
    for i in range(count):
        lines = ['From: Sender %d <sender%d@elsewhere.test>' % (i % 97, i % 97),
                 'To: bench@example.test',
                 'Subject: message number %d about %s' % (i, rnd.choice(WORDS)),
                 'Date: Tue, 14 Nov 2023 22:%02d:%02d +0000' % (i // 60 % 60, i % 60),
                 'Message-ID: <%d.bench@elsewhere.test>' % i,
                 '']
        for _ in range(rnd.randint(10, 160)):
            lines.append(' '.join(rnd.choice(WORDS) for _ in range(rnd.randint(4, 12))))
        if i % 50 == 0:
            lines.append('.a line starting with a dot')
            lines.append('From here on')
        out.append(lines)
    return out


def velmor_mailbox(messages):
    parts = []
    for uid, lines in enumerate(messages, 1):
        head = lines[:lines.index('')]
        body = lines[lines.index('') + 1:]
        parts.append('From sender@elsewhere.test Tue Nov 14 22:13:20 2023\r\n')
        parts.extend(l + '\r\n' for l in head)
        parts.append('X-UID: %d\r\n\r\n' % uid)
        parts.extend(('.' + l if l.startswith('.') else l) + '\r\n' for l in body)
        parts.append('.\r\n')
    return ''.join(parts).encode()


def plain_connect(port, timeout):
    return socket.create_connection(('127.0.0.1', port), timeout=timeout)


# How the lean clients reach a server; the TLS benchmark puts TLS here.
connect = plain_connect


class Client:
    """A lean POP3 client: one socket, replies read by their ends."""

    def __init__(self, port):
        self.sock = connect(port, 60)
        self.buf = b''
        self.line()

    def line(self):
        while b'\r\n' not in self.buf:
            self._more()
        line, _, self.buf = self.buf.partition(b'\r\n')
        return line

    def multi(self):
        while True:
            at = self.buf.find(b'\r\n.\r\n')
            if at >= 0:
                data, self.buf = self.buf[:at + 2], self.buf[at + 5:]
                return data
            self._more()

    def _more(self):
        chunk = self.sock.recv(262144)
        if not chunk:
            raise RuntimeError('connection closed')
        self.buf += chunk

    def cmd(self, text, multi=False):
        self.sock.sendall(text.encode() + b'\r\n')
        first = self.line()
        if not first.startswith(b'+OK'):
            raise RuntimeError('%s: %r' % (text, first))
        if multi:
            self.buf = b'\r\n' + self.buf  # the body starts right behind the status line
            return first, self.multi()[2:]
        return first, b''


def read_all(port, user):
    """One full read; returns (seconds, messages, bytes)."""
    start = time.perf_counter()
    c = Client(port)
    c.cmd('USER ' + user)
    c.cmd('PASS ' + PASSWORD)
    _, listing = c.cmd('LIST', multi=True)
    _, uids = c.cmd('UIDL', multi=True)
    count = len(listing.splitlines())
    if count != len(uids.splitlines()):
        raise RuntimeError('LIST and UIDL disagree')
    total = 0
    for n in range(1, count + 1):
        _, data = c.cmd('RETR %d' % n, multi=True)
        total += len(data)
    c.cmd('QUIT')
    c.sock.close()
    return time.perf_counter() - start, count, total


def best_of(port, user, label):
    read_all(port, user)  # first access builds each server's index
    times = []
    for _ in range(ROUNDS):
        seconds, count, total = read_all(port, user)
        if count != MESSAGES:
            raise RuntimeError('%s served %d messages, not %d' % (label, count, MESSAGES))
        times.append(seconds)
    print('%-8s %d messages, %d bytes: best %.3f s of %s' %
          (label, count, total, min(times), ', '.join('%.3f' % t for t in times)))
    return min(times)


def run_velmor(messages, service='pop', read=None, config=None):
    """Velmor serving the messages as bench's inbox; `read(port, user,
    label)` times it (best_of by default)."""
    suite = Suite(config=dict({'mail.domains': 'example.test'}, **(config or {})))
    try:
        home = suite.path('home/bench')
        Suite._run([VELMOR_BIN, '--root', suite.root, '--adduser', 'bench', '--password', PASSWORD,
                    '--home', home])
        os.makedirs(os.path.join(home, 'mail'), exist_ok=True)
        with open(os.path.join(home, 'mail', 'inbox'), 'wb') as f:
            f.write(velmor_mailbox(messages))
        suite.start()
        return (read or best_of)(suite.port(service), 'bench', 'velmor')
    finally:
        suite.stop()
        suite.cleanup()


def run_dovecot(messages, protocol='pop3', read=None, tls=None):
    """A private Dovecot serving the messages over `protocol` ("pop3" or
    "imap"), timed as run_velmor does; with `tls` (cert, key), on its port
    with TLS from the first byte."""
    server = dovecot.Dovecot(password=PASSWORD, protocol=protocol, tls=tls)
    try:
        server.fill('bench', [('\n'.join(lines) + '\n').encode() for lines in messages])
        return (read or best_of)(server.tls_port if tls else server.port, 'bench', 'dovecot')
    finally:
        server.close()


def main():
    messages = make_messages(MESSAGES)
    ours = run_velmor(messages)
    theirs = run_dovecot(messages)
    print('velmor %.3f s, dovecot %.3f s: velmor takes %.2fx the time of dovecot' % (ours, theirs, ours / theirs))


if __name__ == '__main__':
    main()

"""Reads one 5,000-message mailbox over IMAP from Velmor and from Dovecot's
IMAP server, both on loopback over the same messages (the POP3 benchmark's,
every tenth one made multipart): SELECT, FETCH 1:* (FLAGS ENVELOPE
BODYSTRUCTURE RFC822.SIZE), BODY.PEEK[] of each message, a header-word and
a SINCE UID SEARCH. Prints both times and their ratio.

Run through bench/imap.sh, which installs Dovecot when it is missing."""

import os
import sys
import time

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, HERE)
import pop3_bench  # noqa: E402
from pop3_bench import PASSWORD, make_messages, run_dovecot, run_velmor  # noqa: E402

MESSAGES = int(os.environ.get('IMAP_BENCH_MESSAGES', '5000'))
ROUNDS = int(os.environ.get('IMAP_BENCH_ROUNDS', '3'))
pop3_bench.MESSAGES = MESSAGES


def with_parts(messages):
    """Every tenth message becomes multipart/mixed: its text, then a small
    base64 attachment."""
    out = []
    for i, lines in enumerate(messages):
        if i % 10:
            out.append(lines)
            continue
        blank = lines.index('')
        head, body = lines[:blank], lines[blank + 1:]
        out.append(head + ['MIME-Version: 1.0', 'Content-Type: multipart/mixed; boundary="part-%d"' % i, '',
                           '--part-%d' % i, 'Content-Type: text/plain; charset=us-ascii', ''] + body +
                   ['--part-%d' % i, 'Content-Type: application/octet-stream; name="a.bin"',
                    'Content-Transfer-Encoding: base64', '', 'AAECAwQFBgcICQ==', '--part-%d--' % i])
    return out


class Client:
    """A lean IMAP client: one socket, responses read line by line with
    their literals counted out."""

    def __init__(self, port):
        self.sock = pop3_bench.connect(port, 120)
        self.buf = b''
        self.tag = 0
        self._line()

    def _more(self):
        chunk = self.sock.recv(262144)
        if not chunk:
            raise RuntimeError('connection closed')
        self.buf += chunk

    def _line(self):
        while b'\r\n' not in self.buf:
            self._more()
        line, _, self.buf = self.buf.partition(b'\r\n')
        return line

    def _take(self, n):
        while len(self.buf) < n:
            self._more()
        data, self.buf = self.buf[:n], self.buf[n:]
        return data

    def cmd(self, text):
        """Sends a command; returns (untagged text, literal bytes)."""
        self.tag += 1
        tag = b'b%d' % self.tag
        self.sock.sendall(tag + b' ' + text.encode() + b'\r\n')
        untagged, literal_bytes = [], 0
        while True:
            line = self._line()
            while line.endswith(b'}'):
                n = int(line[line.rindex(b'{') + 1:-1])
                literal_bytes += len(self._take(n))
                line = self._line()
            if line.startswith(tag + b' '):
                if not line.startswith(tag + b' OK'):
                    raise RuntimeError('%s: %r' % (text, line))
                return untagged, literal_bytes
            untagged.append(line)


def read_all(port, user):
    """One full read; returns (seconds, messages, bytes, search hits)."""
    start = time.perf_counter()
    c = Client(port)
    c.cmd('LOGIN %s %s' % (user, PASSWORD))
    lines, _ = c.cmd('SELECT INBOX')
    count = int(next(l for l in lines if l.endswith(b' EXISTS')).split()[1])
    lines, _ = c.cmd('FETCH 1:* (FLAGS ENVELOPE BODYSTRUCTURE RFC822.SIZE)')
    if sum(1 for l in lines if b' FETCH (' in l) != count:
        raise RuntimeError('FETCH 1:* answered %d of %d' % (len(lines), count))
    total = 0
    for n in range(1, count + 1):
        _, got = c.cmd('FETCH %d BODY.PEEK[]' % n)
        total += got
    word, _ = c.cmd('UID SEARCH HEADER Subject modem')
    since, _ = c.cmd('UID SEARCH SINCE 1-Jan-2020')
    c.cmd('LOGOUT')
    c.sock.close()
    hits = (len(word[0].split()) - 2, len(since[0].split()) - 2)
    return time.perf_counter() - start, count, total, hits


def best_of(port, user, label):
    read_all(port, user)  # first access builds each server's index
    times = []
    for _ in range(ROUNDS):
        seconds, count, total, hits = read_all(port, user)
        if count != MESSAGES:
            raise RuntimeError('%s served %d messages, not %d' % (label, count, MESSAGES))
        times.append(seconds)
    print('%-8s %d messages, %d bytes, searches found %d and %d: best %.3f s of %s' %
          (label, count, total, hits[0], hits[1], min(times), ', '.join('%.3f' % t for t in times)))
    return min(times)


def main():
    messages = with_parts(make_messages(MESSAGES))
    ours = run_velmor(messages, 'imap', best_of, {'imap.sock.timeout': '300'})
    theirs = run_dovecot(messages, 'imap', best_of)
    print('velmor %.3f s, dovecot %.3f s: velmor takes %.2fx the time of dovecot' % (ours, theirs, ours / theirs))


if __name__ == '__main__':
    main()

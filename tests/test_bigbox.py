"""A big mailbox: 5,000 messages queued for one user are delivered, read
back whole and in order over POP3 (poplib), and keep their identifiers
across the overview's compaction and a restart."""

import os
import poplib
import time
import unittest

from harness import Suite, VELMOR_BIN, wait_for

DOMAIN = 'example.test'
PASSWORD = 'sesame-42'
COUNT = 5000


def body_of(n):
    return b''.join(b'line %d of message %d\r\n' % (i, n) for i in range(n % 7 + 1))


class BigMailbox(unittest.TestCase):
    def setUp(self):
        self.suite = Suite(config={'mail.domains': DOMAIN, 'pop.sock.timeout': '120'})
        self.addCleanup(self.suite.cleanup)
        self.home = self.suite.path('home/alice')
        Suite._run([VELMOR_BIN, '--root', self.suite.root, '--adduser', 'alice', '--password', PASSWORD,
                    '--home', self.home])
        # The queue files are written straight into the incoming folder, in
        # the order their names sort.
        incoming = self.suite.path('mail/in')
        os.makedirs(incoming, exist_ok=True)
        for n in range(1, COUNT + 1):
            with open(os.path.join(incoming, str(1000000 + n)), 'wb') as f:
                f.write(b'MAIL FROM:<bob@elsewhere.test>\r\nRCPT TO:<alice@' + DOMAIN.encode() + b'>\r\nDATA\r\n'
                        b'From: Bob <bob@elsewhere.test>\r\nSubject: message %d\r\n\r\n' % n + body_of(n) + b'.\r\n')
        self.overview = os.path.join(self.home, 'mail', 'overview', 'inbox')

    def tearDown(self):
        if self.suite.proc is not None and self.suite.proc.poll() is None:
            self.suite.stop()

    def queued(self):
        return [n for n in os.listdir(self.suite.path('mail/in')) if n.isdigit()]

    def pop(self):
        p = poplib.POP3('127.0.0.1', self.suite.port('pop'), timeout=60)
        p.user('alice')
        p.pass_(PASSWORD)
        return p

    def uidl(self, p):
        return [line.split()[1] for line in p.uidl()[1]]

    def overview_text(self):
        with open(self.overview, 'rb') as f:
            return f.read()

    def test_five_thousand_messages_in_order_and_identifiers_that_last(self):
        self.suite.start()
        self.suite.ctl('maildebatch')  # the rest follows without waiting for the quiet time
        self.assertTrue(wait_for(lambda: not self.queued(), timeout=300),
                        '%d left: %s' % (len(self.queued()), self.suite.log('errors')[-2000:]))

        p = self.pop()
        self.assertEqual(p.stat()[0], COUNT)
        uids = self.uidl(p)
        self.assertEqual(uids, [b'%d' % n for n in range(1, COUNT + 1)])
        for n in range(1, COUNT + 1):
            lines = p.retr(n)[1]
            blank = lines.index(b'')
            self.assertIn(b'Subject: message %d' % n, lines[:blank])
            self.assertEqual(b''.join(l + b'\r\n' for l in lines[blank + 1:]), body_of(n))
        # The first 3,000 go: the overview records their removal, and is
        # compacted in the background.
        for n in range(1, 3001):
            p.dele(n)
        self.assertIn(b'(2000 messages left)', p.quit())
        self.assertTrue(wait_for(lambda: b'#expunge' not in self.overview_text(), timeout=60),
                        'the overview was not compacted')
        self.assertEqual(self.overview_text().count(b'#msg\n'), 2000)

        p = self.pop()
        self.assertEqual(self.uidl(p), uids[3000:])
        p.quit()
        self.suite.stop()
        self.suite.start()
        p = self.pop()
        self.assertEqual(self.uidl(p), uids[3000:])
        for n in (1, 1000, 2000):
            self.assertIn(b'Subject: message %d' % (3000 + n), p.retr(n)[1])
        p.quit()


if __name__ == '__main__':
    unittest.main()

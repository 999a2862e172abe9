"""The control channel, through velmorctl and through plain datagram sockets."""

import os
import re
import smtplib
import socket
import stat
import subprocess
import tempfile
import time
import unittest

from harness import Suite, SuiteTestCase, VELMORCTL_BIN, wait_for


def client(timeout=3.0):
    """A datagram socket bound to a fresh abstract address, so replies reach it."""
    s = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
    s.bind('')  # autobind
    s.settimeout(timeout)
    return s


class ControlChannelTest(SuiteTestCase):

    def control(self):
        return self.suite.path('run/control')

    def ask(self, text, sock=None):
        s = sock or client()
        try:
            s.sendto(text.encode(), self.control())
            return s.recv(65536).decode()
        finally:
            if sock is None:
                s.close()

    def silent(self, text):
        """Sends `text` and confirms that no reply comes back."""
        with client(timeout=0.5) as s:
            s.sendto(text.encode(), self.control())
            with self.assertRaises(socket.timeout):
                s.recv(65536)

    def test_test_and_status_answer(self):
        rc, out = self.suite.ctl('test')
        self.assertEqual(rc, 0)
        self.assertRegex(out, r'^test:\d+\n$')
        self.assertLess(abs(int(out[5:]) - time.time()), 5)
        for word in ('status', 'STATUS', 'Status'):
            rc, out = self.suite.ctl(word, raw=True)  # the reply as it came
            self.assertEqual(rc, 0)
            self.assertRegex(out, r'^is:\d+\nmq:\d+\nnq:0\nwf:\d+\npf:\d+\n$')
        # A trailing CR LF is ignored; anything more makes another command.
        self.assertTrue(self.ask('test\r\n').startswith('test:'))
        self.silent('status now')
        self.silent('tests')
        self.silent('')

    def test_queue_listings_end_with_their_end_lines(self):
        rc, out = self.suite.ctl('listmq')
        self.assertEqual(rc, 0)
        self.assertEqual(out.count('start mq\n'), 1, out)
        self.assertTrue(out.startswith('start mq\n'), out)
        self.assertEqual(out.count('end mq\n'), 1, out)
        self.assertTrue(out.endswith('end mq\n'), out)
        rc, out = self.suite.ctl('listnq')
        self.assertEqual(rc, 0)
        self.assertEqual(out, 'start mq\nend nq\n')

    def test_log_facilities_switch(self):
        # Internal command words are logged under the general facility.
        self.assertEqual(self.suite.ctl('nolog house')[0], 0)
        self.suite.ctl('popkick')
        self.assertEqual(self.suite.ctl('test')[0], 0)  # requests are served in order
        self.assertNotIn('popkick', self.suite.log('main'))
        self.suite.ctl('log housekeeping')  # compared by the keyword's length
        self.suite.ctl('smtpkick')
        self.assertTrue(wait_for(lambda: 'smtpkick' in self.suite.log('main')))
        # Without the blank nothing is switched.
        self.suite.ctl('nologhouse')
        self.suite.ctl('newskick')
        self.assertTrue(wait_for(lambda: 'newskick' in self.suite.log('main')))

    def test_password_change_with_a_wrong_password_is_refused_and_never_logged(self):
        rc, out = self.suite.ctl('change pass demo not-the-password Sekrit-New-42')
        self.assertEqual(out, '1\n')
        self.assertNotEqual(rc, 0)
        self.assertEqual(self.ask('change pass'), '1')  # words missing
        self.assertEqual(self.ask('change pass demo %s new' % ('x' * 70)), '1')
        self.assertEqual(self.ask('test'), self.ask('test'))  # still serving
        for name in ('main', 'errors'):
            self.assertNotIn('Sekrit-New-42', self.suite.log(name))
            self.assertNotIn('not-the-password', self.suite.log(name))

    def test_a_client_that_never_reads_cannot_hold_up_the_others(self):
        greedy = client(timeout=20)
        for _ in range(5000):
            greedy.sendto(b'test', self.control())
        start = time.monotonic()
        reply = self.ask('test')
        self.assertTrue(reply.startswith('test:'))
        self.assertLess(time.monotonic() - start, 2.0)
        greedy.close()
        self.assertEqual(self.suite.ctl('status')[0], 0)
        self.assertIsNone(self.suite.proc.poll())

    def test_socket_is_private_and_velmorctl_fails_without_an_answer(self):
        mode = os.stat(self.control()).st_mode
        self.assertTrue(stat.S_ISSOCK(mode))
        self.assertEqual(stat.S_IMODE(mode), 0o660)
        # Nobody at the path.
        missing = self.suite.path('run/nobody')
        r = subprocess.run([VELMORCTL_BIN, '--control', missing, 'test'], capture_output=True, timeout=10)
        self.assertNotEqual(r.returncode, 0)
        # Someone at the path who never answers.
        silent = self.suite.path('run/silent')
        with socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM) as s:
            s.bind(silent)
            r = subprocess.run([VELMORCTL_BIN, '--control', silent, 'status'], capture_output=True, timeout=10)
            self.assertNotEqual(r.returncode, 0)
            self.assertEqual(s.recv(100), b'status')
            self.assertEqual(s.recv(100), b'incoming')  # status in words asks for that queue too
            # A command without a reply does not wait for one.
            r = subprocess.run([VELMORCTL_BIN, '--control', silent, 'reload', 'users'],
                               capture_output=True, timeout=10)
            self.assertEqual(r.returncode, 0)
            self.assertEqual(s.recv(100), b'reload users')
        r = subprocess.run([VELMORCTL_BIN], capture_output=True, timeout=10)
        self.assertEqual(r.returncode, 2)


class VelmorctlTest(SuiteTestCase):
    config = {'mail.debatch.time': '0'}  # delivered only on "maildebatch"

    def test_status_in_words(self):
        with smtplib.SMTP('127.0.0.1', self.suite.port('smtp'), timeout=10) as c:
            c.sendmail('ann@example.org', ['demo@localhost'], b'Subject: hi\r\n\r\nhello\r\n')
        rc, out = self.suite.ctl('status')
        self.assertEqual(rc, 0, out)
        lines = [' '.join(line.split()) for line in out.splitlines()]
        for wanted in ('Incoming mail: 1 message waiting to be delivered',
                       'Outgoing mail: 0 messages waiting to be sent',
                       'News: 0 articles waiting to be sent', 'Link: down'):
            self.assertIn(wanted, lines)
        self.suite.ctl('maildebatch')
        self.assertTrue(wait_for(lambda: 'Incoming mail: 0 messages waiting to be delivered'
                                 in ' '.join(self.suite.ctl('status')[1].split()), 10))
        # ... and the mail log says where it went.
        self.assertRegex(self.suite.log('mail'), r'(?m) -> Delivered: demo@localhost to %s \(\d+ bytes\)$'
                         % re.escape(self.suite.path('home/demo/mail/inbox')))


class VelmorctlCommandLineTest(unittest.TestCase):

    def run_ctl(self, *args):
        return subprocess.run([VELMORCTL_BIN] + list(args), capture_output=True, text=True, timeout=10)

    def test_help_version_and_an_unknown_command(self):
        r = self.run_ctl('help')
        self.assertEqual(r.returncode, 0)
        listed = [line.split()[0] for line in r.stdout.splitlines() if line.startswith('  ') and
                  not line.startswith('  --')]
        for word in ('status', 'test', 'listmq', 'listnq', 'reload', 'change', 'log', 'nolog', 'clear',
                     'maildebatch', 'mailrescan', 'mailtransfer', 'connect', 'disconnect', 'smtpkick',
                     'popkick', 'newskick', 'newsdebatch', 'lookup', 'help'):
            self.assertIn(word, listed)
        r = self.run_ctl('--version')
        self.assertEqual((r.returncode, r.stdout), (0, 'velmorctl 2.0.49\n'))
        # Refused here, never sent: the suite would ignore it without a word.
        with tempfile.TemporaryDirectory() as d, socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM) as s:
            path = os.path.join(d, 'control')
            s.bind(path)
            for bad in (['stauts'], ['log', 'nosuch'], ['lookup']):
                r = self.run_ctl('--control', path, *bad)
                self.assertEqual(r.returncode, 2, bad)
                self.assertIn('velmorctl help lists the commands', r.stderr)
            self.assertIn("unknown command 'stauts'", self.run_ctl('--control', path, 'stauts').stderr)
            s.setblocking(False)
            with self.assertRaises(BlockingIOError):
                s.recv(100)


class ControlSocketLifetimeTest(unittest.TestCase):

    def test_a_stale_socket_is_replaced_and_a_foreign_file_is_left_at_shutdown(self):
        suite = Suite()
        self.addCleanup(suite.cleanup)
        path = suite.path('run/control')
        os.makedirs(os.path.dirname(path), exist_ok=True)
        # What a crash leaves behind: a socket file nobody serves.
        with socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM) as s:
            s.bind(path)
        suite.start()
        self.assertEqual(suite.ctl('test')[0], 0)
        # The suite removes only the socket it made.
        os.unlink(path)
        with open(path, 'w') as f:
            f.write('not a socket\n')
        self.assertEqual(suite.stop(), 0)
        self.assertTrue(os.path.isfile(path))
        os.unlink(path)
        suite.start()
        self.assertEqual(suite.stop(), 0)
        self.assertFalse(os.path.exists(path))

    def test_a_path_someone_holds_stops_start_up_and_velmorctl_refuses_a_strangers_socket(self):
        suite = Suite()
        self.addCleanup(suite.cleanup)
        path = suite.path('run/control')
        with socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM) as squatter:
            squatter.bind(path)  # alive, so not taken for a crashed suite's
            suite.spawn()
            self.assertEqual(suite.wait(timeout=10), 1)
            self.assertIn('Socket initialisation failed', suite.output())
            if os.geteuid() != 0:
                self.skipTest('making a socket of another user needs root')
            os.chown(path, 54321, 54321)
            r = subprocess.run([VELMORCTL_BIN, '--root', suite.root, 'change', 'pass', 'demo', 'old', 'new'],
                               capture_output=True, timeout=10)
            self.assertEqual(r.returncode, 1)
            self.assertIn(b'neither root nor the suite', r.stderr)
            squatter.setblocking(False)
            with self.assertRaises(BlockingIOError):
                squatter.recv(100)


if __name__ == '__main__':
    unittest.main()

"""The SMTP server with real clients: smtplib, raw sockets, swaks and curl.

Debatching is off (mail.debatch.time 0), so every accepted message stays in
the incoming queue where the tests read it back.
"""
import os
import re
import select
import shutil
import smtplib
import socket
import subprocess
import threading
import time
import unittest

import netns
from harness import Suite, SuiteTestCase, wait_for

NO_DEBATCH = {'mail.debatch.time': '0', 'mail.domains': 'localhost, site.example'}


def queue_files(suite, folder='mail/in'):
    d = suite.path(folder)
    return sorted((os.path.join(d, n) for n in os.listdir(d) if n.isdigit()),
                  key=lambda p: int(os.path.basename(p)))


def hidden_files(suite, folder='mail/in'):
    return [n for n in os.listdir(suite.path(folder)) if n.startswith('.')]


def read(path):
    with open(path, 'rb') as f:
        return f.read()


class Conversation:
    """A raw SMTP connection for the replies clients don't let us see."""

    def __init__(self, port):
        self.sock = socket.create_connection(('127.0.0.1', port), timeout=10)
        self.buf = b''
        self.greeting = self.line()

    def line(self):
        while b'\r\n' not in self.buf:
            chunk = self.sock.recv(65536)
            if not chunk:
                raise EOFError('connection closed; got %r' % self.buf)
            self.buf += chunk
        line, self.buf = self.buf.split(b'\r\n', 1)
        return line.decode('latin-1')

    def send(self, data):
        self.sock.sendall(data if isinstance(data, bytes) else data.encode('latin-1'))

    def cmd(self, text):
        self.send(text + '\r\n')
        return self.line()

    def waiting_bytes(self):
        """Bytes the server sent that this side has not read yet."""
        if not select.select([self.sock], [], [], 0)[0]:
            return len(self.buf)
        return len(self.buf) + len(self.sock.recv(1 << 20, socket.MSG_PEEK))

    def wait_closed(self):
        """Reads until the server closes the connection."""
        while self.sock.recv(65536):
            pass

    def close(self):
        self.sock.close()


class SmtpServerTest(SuiteTestCase):
    config = NO_DEBATCH

    def test_smtplib_local_and_remote_recipients_from_loopback(self):
        message = ('From: Ann <ann@far.example>\r\nTo: postmaster@localhost\r\n'
                   'Subject: greetings\r\n\r\nfirst line\r\n.hidden dot line\r\n..two dots\r\nlast\r\n')
        with smtplib.SMTP('127.0.0.1', self.suite.port('smtp'), timeout=10) as c:
            refused = c.sendmail('ann@far.example', ['postmaster@localhost', 'bob@remote.example'], message)
            self.assertEqual(refused, {})
            # EHLO names the extensions; SIZE is the default group's limit (10240 kB).
            self.assertEqual(c.esmtp_features, {'pipelining': '', 'size': '10485760', '8bitmime': '', 'help': '',
                                                'starttls': '', 'auth': ' PLAIN LOGIN'})
        files = queue_files(self.suite)
        self.assertEqual(len(files), 1)
        data = read(files[0])
        head, body = data.split(b'\r\n\r\n', 1)
        lines = head.split(b'\r\n')
        self.assertEqual(lines[0], b'MAIL FROM:<ann@far.example>')
        self.assertEqual(lines[1], b'RCPT TO:<postmaster@localhost>')
        self.assertEqual(lines[2], b'RCPT TO:<bob@remote.example>')
        self.assertEqual(lines[3], b'DATA')
        self.assertEqual(lines[4], b'Received: from 127.0.0.1')
        self.assertTrue(lines[5].startswith(b'\tby ') and b'with SMTP (Velmor Server Suite v2.0.49 [Linux/i386]);' in lines[5])
        self.assertRegex(lines[6].decode(), r'^\t\w{3}, \d\d \w{3} \d{4} \d\d:\d\d:\d\d [+-]\d{4}$')
        self.assertEqual(lines[7], b'X-Sender: ann@far.example')
        self.assertEqual(lines[8], b'From: Ann <ann@far.example>')
        # No Date in the message: one was added as its last header line.
        self.assertRegex(lines[-1].decode(), r'^Date: \w{3}, \d\d \w{3} \d{4} \d\d:\d\d:\d\d [+-]\d{4}$')
        # Dot lines stay in their stuffed form, and the terminator is stored.
        self.assertEqual(body, b'first line\r\n..hidden dot line\r\n...two dots\r\nlast\r\n.\r\n')
        self.assertEqual(hidden_files(self.suite), [])

    def test_reply_texts_and_command_errors(self):
        c = Conversation(self.suite.port('smtp'))
        self.assertRegex(c.greeting, r'^220 \S+ Velmor Server Suite SMTP Server  \(v2\.0\.49 \[Linux/i386\]\) ready at '
                                     r'\d\d:\d\d:\d\d, \d\d \w{3} - Report problems to \S+$')
        self.assertRegex(c.cmd('EHLO me.example'), r"^250-\S+ Hello me.example, how's life\?$")
        self.assertEqual([c.line() for _ in range(6)], ['250-PIPELINING', '250-SIZE 10485760', '250-8BITMIME', '250-HELP',
                                                        '250-STARTTLS', '250 AUTH PLAIN LOGIN'])
        self.assertEqual(c.cmd('HELO me.example'), "250 Hello me.example, how's life?")
        self.assertEqual(c.cmd('VERYLONGVERB x'), '500 Bad command - too long')
        self.assertEqual(c.line(), '500 Unknown command:VERYLONGVE')
        self.assertEqual(c.cmd('RCPT TO:<postmaster@localhost>'), '503 Need MAIL before RCPT')
        self.assertEqual(c.cmd('DATA'), '503 Need MAIL before DATA')
        self.assertEqual(c.cmd('MAIL FROM x'), '501 Syntax: MAIL FROM:<address>')
        self.assertEqual(c.cmd('MAIL FROM:<' + 'a' * 300 + '@x>'), '501 Address too long')
        self.assertEqual(c.cmd('MAIL FROM:<>'), '250 OK Sender accepted')
        self.assertEqual(c.cmd('DATA'), '503 Need RCPT before DATA')
        self.assertEqual(c.cmd('RCPT TO:<>'), '501 Syntax: RCPT TO:<address>')
        self.assertEqual(c.cmd('VRFY nosuchuser'), '550 Unknown user (Server only checks mailbox/login names)')
        self.assertRegex(c.cmd('VRFY demo'), r'^250 .* <demo@localhost>$')  # loopback is the site's own
        self.assertEqual(c.cmd('TURN'), '502 TURN not available')
        self.assertEqual(c.cmd('NOOP'), '250 OK')
        self.assertEqual(c.cmd('RSET'), '250 Reset OK')
        # Bare LF line ends are accepted for commands.
        c.send('HELO bare\n')
        self.assertEqual(c.line(), "250 Hello bare, how's life?")
        # QUIT after RCPT without DATA leaves nothing behind.
        self.assertEqual(c.cmd('MAIL FROM:<x@far.example>'), '250 OK Sender accepted')
        self.assertEqual(c.cmd('RCPT TO:<postmaster@localhost>'), '250 OK Recipient syntactically correct')
        self.assertEqual(len(hidden_files(self.suite)), 1)  # the transaction's file
        self.assertRegex(c.cmd('QUIT'), r'^221 \S+ Velmor SMTP Server \(2\.0\.49\) closing connection at ')
        c.wait_closed()  # the session has let go of everything by now
        c.close()
        self.assertEqual(queue_files(self.suite), [])
        self.assertEqual(hidden_files(self.suite), [])

    def test_pipelined_commands_and_a_client_that_does_not_read(self):
        c = Conversation(self.suite.port('smtp'))
        # Three commands in one send: three replies, and the null sender is "Unknown".
        c.send('MAIL FROM:<>\r\nRCPT TO:<postmaster@localhost>\r\nDATA\r\nSubject: p\r\n\r\nbody\r\n.\r\n')
        self.assertEqual(c.line(), '250 OK Sender accepted')
        self.assertEqual(c.line(), '250 OK Recipient syntactically correct')
        self.assertTrue(c.line().startswith('354 '))
        self.assertEqual(c.line(), '250 OK')
        self.assertIn(b'\r\nX-Sender: Unknown\r\n', read(queue_files(self.suite)[0]))
        # Far more NOOPs than the output buffer holds replies for, unread:
        # the server waits for the client instead of dropping replies.
        count = 6000
        c.send('NOOP\r\n' * count)
        # Nothing is read until every reply has arrived.
        self.assertTrue(wait_for(lambda: c.waiting_bytes() >= count * len('250 OK\r\n'), 10))
        replies = [c.line() for _ in range(count)]
        self.assertEqual(set(replies), {'250 OK'})
        self.assertEqual(c.cmd('NOOP'), '250 OK')
        c.close()

    def test_overlong_line_is_refused_and_the_transaction_survives(self):
        c = Conversation(self.suite.port('smtp'))
        self.assertEqual(c.cmd('MAIL FROM:<ann@far.example>'), '250 OK Sender accepted')
        c.send('RCPT TO:<' + 'x' * 100000 + '@localhost>\r\n')
        self.assertEqual(c.line(), '500 Line too long')
        self.assertEqual(c.cmd('RCPT TO:<postmaster@localhost>'), '250 OK Recipient syntactically correct')
        self.assertTrue(c.cmd('DATA').startswith('354'))
        c.send('Subject: s\r\n\r\nok\r\n.\r\n')
        self.assertEqual(c.line(), '250 OK')
        c.close()
        data = read(queue_files(self.suite)[0])
        self.assertEqual(data.count(b'RCPT TO'), 1)

    def test_bare_lf_message_is_stored_with_crlf(self):
        c = Conversation(self.suite.port('smtp'))
        c.cmd('MAIL FROM:<ann@far.example>')
        c.cmd('RCPT TO:<postmaster@localhost>')
        self.assertTrue(c.cmd('DATA').startswith('354'))
        c.send('Subject: bare\nDate: Mon, 1 Jan 2024 00:00:00 +0000\n\nline one\nline two\n.\n')
        self.assertEqual(c.line(), '250 OK')
        c.close()
        data = read(queue_files(self.suite)[0])
        self.assertTrue(data.endswith(b'\r\n\r\nline one\r\nline two\r\n.\r\n'))
        self.assertNotIn(b'\n', data.replace(b'\r\n', b''))
        self.assertEqual(data.count(b'\r\nDate:'), 1)

    def test_ten_megabyte_message(self):
        line = b'0123456789' * 7 + b'\r\n'
        body = line * (10 * 1000 * 1000 // len(line))  # just inside the default 10240 kB limit
        message = b'Subject: big\r\n\r\n' + body
        with smtplib.SMTP('127.0.0.1', self.suite.port('smtp'), timeout=30) as c:
            c.sendmail('ann@far.example', ['postmaster@localhost'], message)
        data = read(queue_files(self.suite)[0])
        self.assertTrue(data.endswith(body + b'.\r\n'))

    def test_disconnect_in_the_middle_of_data_leaves_no_file(self):
        c = Conversation(self.suite.port('smtp'))
        c.cmd('MAIL FROM:<ann@far.example>')
        c.cmd('RCPT TO:<postmaster@localhost>')
        self.assertTrue(c.cmd('DATA').startswith('354'))
        c.send(b'Subject: cut\r\n\r\n' + b'x' * 200000 + b'\r\nmore')
        self.assertEqual(len(hidden_files(self.suite)), 1)
        c.close()
        # The unfinished message's file goes with the connection.
        self.assertTrue(wait_for(lambda: hidden_files(self.suite) == [], 10))
        self.assertEqual(queue_files(self.suite), [])
        # The server is still there for the next client.
        with smtplib.SMTP('127.0.0.1', self.suite.port('smtp'), timeout=10) as s:
            s.sendmail('a@far.example', ['postmaster@localhost'], 'Subject: after\r\n\r\nx\r\n')
        self.assertEqual(len(queue_files(self.suite)), 1)

    def test_envelopes_are_stored_as_judged_each_recipient_once_and_at_most_a_hundred(self):
        recipients = ['postmaster@localhost'] * 3 + ['u%d@remote.example' % i for i in range(100)]
        with smtplib.SMTP('127.0.0.1', self.suite.port('smtp'), timeout=10) as c:
            refused = c.sendmail('ann@far.example', recipients, 'Subject: many\r\n\r\nx\r\n')
        self.assertEqual(refused, {'u99@remote.example': (452, b'Too many recipients')})
        envelope = read(queue_files(self.suite)[0]).split(b'\r\nDATA\r\n')[0].split(b'\r\n')
        self.assertEqual(envelope[1:3], [b'RCPT TO:<postmaster@localhost>', b'RCPT TO:<u0@remote.example>'])
        self.assertEqual(len(envelope), 101)
        # The file holds the addresses as parsed, never the client's lines;
        # a line over the limit is refused whole, never acted on in part.
        c = Conversation(self.suite.port('smtp'))
        c.cmd('HELO me')
        self.assertEqual(c.cmd('MAIL FROM: <ann@far.example>  '), '250 OK Sender accepted')
        self.assertEqual(c.cmd('RCPT TO: <a b@localhost>'), '501 Syntax: RCPT TO:<address>')
        self.assertEqual(c.cmd('RCPT TO:' + ' ' * 600 + '<postmaster@localhost>'), '500 Line too long')
        self.assertEqual(c.cmd('rcpt to:   postmaster@localhost '), '250 OK Recipient syntactically correct')
        self.assertTrue(c.cmd('DATA').startswith('354'))
        self.assertEqual(c.cmd('Subject: s\r\n\r\nx\r\n.'), '250 OK')
        c.close()
        self.assertTrue(read(queue_files(self.suite)[1]).startswith(
            b'MAIL FROM:<ann@far.example>\r\nRCPT TO:<postmaster@localhost>\r\nDATA\r\n'))

    @unittest.skipUnless(shutil.which('swaks'), 'swaks is not installed')
    def test_swaks(self):
        out = subprocess.run(['swaks', '--server', '127.0.0.1', '--port', str(self.suite.port('smtp')),
                              '--from', 'ann@far.example', '--to', 'postmaster@localhost',
                              '--header', 'Subject: from swaks', '--body', 'swaks body'],
                             capture_output=True, text=True, timeout=30)
        self.assertEqual(out.returncode, 0, out.stdout + out.stderr)
        data = read(queue_files(self.suite)[0])
        self.assertIn(b'Subject: from swaks', data)
        self.assertTrue(data.endswith(b'\r\n.\r\n'))

    @unittest.skipUnless(shutil.which('curl'), 'curl is not installed')
    def test_curl(self):
        message = 'From: ann@far.example\r\nSubject: from curl\r\n\r\ncurl body\r\n'
        out = subprocess.run(['curl', '-sS', '--max-time', '20', 'smtp://127.0.0.1:%d/client.example' % self.suite.port('smtp'),
                              '--mail-from', 'ann@far.example', '--mail-rcpt', 'postmaster@localhost',
                              '--upload-file', '-'], input=message, capture_output=True, text=True, timeout=30)
        self.assertEqual(out.returncode, 0, out.stdout + out.stderr)
        data = read(queue_files(self.suite)[0])
        self.assertIn(b'Subject: from curl', data)
        self.assertIn(b'RCPT TO:<postmaster@localhost>', data)


class RelayTest(SuiteTestCase):
    # smtp.allow names another peer, so loopback is a stranger here.
    config = dict(NO_DEBATCH, **{'smtp.allow': '192.0.2.1'})

    def test_a_stranger_may_not_relay_but_may_deliver_locally(self):
        c = Conversation(self.suite.port('smtp'))
        c.cmd('HELO stranger')
        self.assertEqual(c.cmd('MAIL FROM:<someone@far.example>'), '250 OK Sender accepted')
        self.assertEqual(c.cmd('RCPT TO:<victim@elsewhere.example>'), '550 Posting to this address forbidden')
        self.assertEqual(c.cmd('RCPT TO:<postmaster@site.example>'), '250 OK Recipient syntactically correct')
        self.assertEqual(c.cmd('TURN'), '502 TURN not available')
        c.close()


class PublicPeerTest(unittest.TestCase):
    """A stranger on a public address, seen by the relay check as it is."""

    def test_a_padded_recipient_is_judged_as_it_would_be_delivered(self):
        with netns.PublicPeer() as peer:
            suite = Suite(config=dict(NO_DEBATCH, **{'mail.domains': 'localhost, *.example.com'}), bind=peer.host_ip)
            try:
                suite.start()
                replies = peer.talk(suite.port('smtp'), [
                    'HELO stranger', 'MAIL FROM:<someone@far.example>', 'RCPT TO:<victim@evil.org>',
                    'RCPT TO:' + ' ' * 4072 + '<victim@evil.org.example.com>', 'RCPT TO:<demo@localhost>',
                    'DATA', 'Subject: relay?\r\n\r\nbody\r\n.', 'VRFY demo', 'QUIT'])
                self.assertEqual(replies[3:6], ['550 Posting to this address forbidden', '500 Line too long',
                                                '250 OK Recipient syntactically correct'])
                self.assertEqual(replies[7], '250 OK')
                # Who the users are is for the site's own network only.
                self.assertEqual(replies[8], '252 Cannot VRFY user, but will accept message and attempt delivery')
                [queued] = queue_files(suite)
                self.assertTrue(read(queued).startswith(
                    b'MAIL FROM:<someone@far.example>\r\nRCPT TO:<demo@localhost>\r\nDATA\r\n'))
                deadline = time.monotonic() + 15
                while queue_files(suite) and time.monotonic() < deadline:
                    suite.ctl('maildebatch')
                    time.sleep(0.1)
                self.assertEqual(queue_files(suite), [])
                self.assertFalse(any(b'evil.org' in read(p) for p in queue_files(suite, 'mail/out')))
            finally:
                suite.cleanup()


class LimitAndRecipientTest(unittest.TestCase):
    """Every stranger may send 1 kB; config/aliases is the one --init wrote,
    with one alias more."""

    def setUp(self):
        self.suite = Suite(config=NO_DEBATCH)
        self.addCleanup(self.suite.cleanup)
        with open(self.suite.path('config/groups'), 'w') as f:
            f.write('#0\n%group.name: everyone\n%mail.msg.size: 1\n%mail.smtp.send: yes\n')
        with open(self.suite.path('config/aliases'), 'a') as f:
            f.write('team demo\n')
        self.suite.start()

    def test_a_message_over_the_limit_is_refused_at_mail_or_at_the_end_of_its_data(self):
        big = 'Subject: large\r\n\r\n' + ('z' * 70 + '\r\n') * 40
        with smtplib.SMTP('127.0.0.1', self.suite.port('smtp'), timeout=10) as c:
            c.ehlo('me.example')
            self.assertEqual(c.esmtp_features['size'], '1024')
            # smtplib declares the size: refused before any data is sent.
            with self.assertRaises(smtplib.SMTPSenderRefused) as refused:
                c.sendmail('ann@far.example', ['postmaster@localhost'], big)
            self.assertEqual(refused.exception.smtp_code, 552)
            # Declared small, sent large: refused at the end, nothing kept.
            self.assertEqual(c.mail('ann@far.example', ['SIZE=100'])[0], 250)
            self.assertEqual(c.rcpt('postmaster@localhost')[0], 250)
            self.assertEqual(c.data(big), (552, b'Message size exceeds fixed maximum message size'))
            self.assertEqual(queue_files(self.suite), [])
            self.assertEqual(hidden_files(self.suite), [])
            self.assertEqual(c.sendmail('ann@far.example', ['postmaster@localhost'], 'Subject: small\r\n\r\nx\r\n'), {})
        self.assertEqual(len(queue_files(self.suite)), 1)

    def test_unknown_local_users_are_refused_and_postmaster_sub_addresses_and_aliases_delivered(self):
        c = Conversation(self.suite.port('smtp'))
        c.cmd('HELO me')
        c.cmd('MAIL FROM:<ann@far.example>')
        self.assertEqual(c.cmd('RCPT TO:<nosuchuser@site.example>'), '550 Unknown local user <nosuchuser@site.example>')
        for known in ('PostMaster@site.example', 'demo_work@localhost', 'team@site.example'):
            self.assertEqual(c.cmd('RCPT TO:<%s>' % known), '250 OK Recipient syntactically correct')
        self.assertTrue(c.cmd('DATA').startswith('354'))
        self.assertEqual(c.cmd('Subject: for postmaster\r\n\r\nx\r\n.'), '250 OK')
        c.close()
        self.assertNotIn(b'nosuchuser', read(queue_files(self.suite)[0]))
        # postmaster is the administrator: the alias --init wrote names demo.
        deadline = time.monotonic() + 15
        while queue_files(self.suite) and time.monotonic() < deadline:
            self.suite.ctl('maildebatch')
            time.sleep(0.1)
        self.assertIn(b'Subject: for postmaster', read(self.suite.path('home/demo/mail/inbox')))
        self.assertIn(b'Subject: for postmaster', read(self.suite.path('home/demo/mail/work')))
        self.assertEqual(queue_files(self.suite, 'mail/odd'), [])
        # One mail log: every line has the same stamp, and the SMTP lines name the client.
        log = self.suite.log('mail').splitlines()
        self.assertTrue(all(re.match(r'\d\d:\d\d:\d\d, \d\d \w{3} -> ', line) for line in log), log)
        self.assertTrue(any(line.endswith(' 127.0.0.1 - RCPT TO:<nosuchuser@site.example>') for line in log), log)
        self.assertTrue(any(re.search(r'-> \d+ <ann@far\.example> PostMaster@site\.example demo_work@localhost', line)
                            for line in log), log)

    def test_the_greeting_names_the_administrator_with_the_domain_after_a_reload(self):
        for reload in (False, True):
            if reload:
                self.assertEqual(self.suite.ctl('reload config')[0], 0)
            c = Conversation(self.suite.port('smtp'))
            self.assertTrue(c.greeting.endswith(' - Report problems to postmaster@localhost'), c.greeting)
            c.close()


class BlockTest(SuiteTestCase):
    config = dict(NO_DEBATCH, **{'smtp.block': '127.0.0.1'})

    def test_blocked_peer_is_refused_at_once(self):
        with socket.create_connection(('127.0.0.1', self.suite.port('smtp')), timeout=10) as s:
            data = b''
            while True:
                chunk = s.recv(1000)
                if not chunk:
                    break
                data += chunk
        self.assertRegex(data.decode(), r'^421 \S+ connection refused\r\n$')


class NoGroupsTest(SuiteTestCase):
    config = NO_DEBATCH

    def test_a_local_sender_without_a_group_set_may_not_send(self):
        # Without a groups file no set grants anything: a local user's mail is
        # refused, while a stranger may still deliver to a local user.
        self.suite.stop()
        os.remove(self.suite.path('config/groups'))
        self.suite.start()
        c = Conversation(self.suite.port('smtp'))
        try:
            c.cmd('HELO me')
            self.assertEqual(c.cmd('MAIL FROM:<demo@localhost>'), '250 OK Sender accepted')
            self.assertEqual(c.cmd('RCPT TO:<postmaster@localhost>'), '550 posting denied')
            c.cmd('MAIL FROM:<ann@far.example>')
            self.assertEqual(c.cmd('RCPT TO:<demo@localhost>'),
                             '250 OK Recipient syntactically correct')
        finally:
            c.close()


class CrashTest(unittest.TestCase):
    """SIGKILL while a message is being received: a queue file is either
    whole (acknowledged before the kill) or absent, never half."""

    def test_sigkill_while_queueing(self):
        suite = Suite(config=NO_DEBATCH)
        suite.start()
        try:
            port = suite.port('smtp')
            with smtplib.SMTP('127.0.0.1', port, timeout=10) as c:
                c.sendmail('ann@far.example', ['bob@remote.example'], 'Subject: whole\r\n\r\nsafe\r\n')
            c = Conversation(port)
            c.cmd('MAIL FROM:<ann@far.example>')
            c.cmd('RCPT TO:<bob@remote.example>')
            c.cmd('DATA')
            c.send(b'Subject: half\r\n\r\n' + b'y' * 500000)
            self.assertEqual(len(hidden_files(suite)), 1)  # the message is being received
            suite.kill()  # SIGKILL
            c.close()
            files = queue_files(suite)
            self.assertEqual(len(files), 1)
            self.assertTrue(read(files[0]).endswith(b'\r\nsafe\r\n.\r\n'))
            # A restart clears what was never acknowledged, and the whole
            # message is debatched (into the outgoing queue).
            if os.path.exists(suite.pid_file):
                os.unlink(suite.pid_file)
            suite.start()
            self.assertEqual(hidden_files(suite), [])
            suite.ctl('maildebatch')
            deadline = time.time() + 10
            while time.time() < deadline and not queue_files(suite, 'mail/out'):
                time.sleep(0.1)
            out = queue_files(suite, 'mail/out')
            self.assertEqual(len(out), 1)
            self.assertTrue(read(out[0]).endswith(b'\r\nsafe\r\n.\r\n'))
            self.assertEqual(queue_files(suite), [])
        finally:
            suite.cleanup()


if __name__ == '__main__':
    unittest.main()

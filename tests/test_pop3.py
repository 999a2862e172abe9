"""Mail from SMTP to the mailbox and out through POP3, with real clients:
smtplib in, poplib, fetchmail and curl out."""

import imaplib
import os
import poplib
import select
import shutil
import signal
import smtplib
import socket
import subprocess
import tempfile
import time
import unittest

from harness import Suite, VELMOR_BIN, set_keys, wait_for

DOMAIN = 'example.test'
PASSWORD = 'sesame-42'

BODY = (b'Hello Alice.\r\n'
        b'.a line that starts with a dot\r\n'
        b'..two dots\r\n'
        b'.\r\n'
        b'From here on the body goes on\r\n'
        b'Status: RO\r\n'
        b'\r\n'
        b'last line\r\n')


def make_message(subject, body=BODY, extra=b''):
    return (b'From: Bob <bob@elsewhere.test>\r\n'
            b'To: alice@' + DOMAIN.encode() + b'\r\n'
            b'Subject: ' + subject.encode() + b'\r\n'
            b'Message-ID: <' + subject.replace(' ', '.').encode() + b'@elsewhere.test>\r\n' + extra +
            b'\r\n' + body)


def split_message(data):
    header, _, body = data.partition(b'\r\n\r\n')
    return header.split(b'\r\n'), body


BAD_LOGIN = b'-ERR Invalid username or password, please try again\r\n'
IN_SESSION = b'-ERR Invalid command; valid commands:  STAT, LIST, UIDL, TOP, RETR, DELE, RSET, NOOP, QUIT\r\n'


class MailSuite(unittest.TestCase):
    """A suite with the user alice (full name Alice Liddell) and her home."""
    config = {}

    def setUp(self):
        self.suite = Suite(config=dict({'mail.domains': DOMAIN, 'pop.sock.timeout': '30'}, **self.config))
        self.addCleanup(self.suite.cleanup)
        self.home = self.suite.path('home/alice')
        Suite._run([VELMOR_BIN, '--root', self.suite.root, '--adduser', 'alice', '--password', PASSWORD,
                    '--full-name', 'Alice Liddell', '--home', self.home])
        self.suite.start()
        self.inbox = os.path.join(self.home, 'mail', 'inbox')

    def tearDown(self):
        if self.suite.proc is not None and self.suite.proc.poll() is None:
            self.suite.stop()

    def send(self, *messages):
        with smtplib.SMTP('127.0.0.1', self.suite.port('smtp'), timeout=10) as smtp:
            for m in messages:
                smtp.sendmail('bob@elsewhere.test', ['alice@' + DOMAIN], m)
        self.debatch(len(messages))

    def debatch(self, count):
        deadline = time.monotonic() + 15
        while time.monotonic() < deadline:
            self.suite.ctl('maildebatch')
            if self.delivered() >= count:
                return
            time.sleep(0.05)
        self.fail('not delivered: %s' % self.suite.log('main')[-2000:])

    def delivered(self):
        try:
            with open(self.inbox, 'rb') as f:
                return f.read().count(b'\r\nX-Processed-By: ')
        except FileNotFoundError:
            return 0

    def pop(self, user='alice', password=PASSWORD):
        p = poplib.POP3('127.0.0.1', self.suite.port('pop'), timeout=10)
        self.addCleanup(p.close)
        p.user(user)
        p.pass_(password)
        return p

    def pop_when_free(self):
        """Logs alice in as soon as a closed session has let go of her mailbox."""
        deadline = time.monotonic() + 10
        while True:
            p = poplib.POP3('127.0.0.1', self.suite.port('pop'), timeout=10)
            try:
                p.user('alice')
                p.pass_(PASSWORD)
                self.addCleanup(p.close)
                return p
            except poplib.error_proto:
                p.close()
                if time.monotonic() > deadline:
                    raise
                time.sleep(0.05)

    def raw(self):
        """A plain connection: send lines, read reply lines."""
        s = socket.create_connection(('127.0.0.1', self.suite.port('pop')), timeout=10)
        self.addCleanup(s.close)
        f = s.makefile('rb')
        greeting = f.readline()
        self.assertTrue(greeting.startswith(b'+OK '), greeting)
        self.assertIn(b'Velmor Server Suite POP3 Server (v2.0.49 [Linux/i386]) ready at', greeting)

        def talk(line, replies=1):
            s.sendall(line + b'\r\n')
            return [f.readline() for _ in range(replies)]
        return s, f, talk


class RoundTrip(MailSuite):
    def test_message_comes_back_byte_for_byte_and_quit_removes_deletions(self):
        first, second = make_message('first one'), make_message('second one', body=b'short\r\n')
        self.send(first, second)
        p = self.pop()
        self.assertEqual(p.stat()[0], 2)
        _, listing, _ = p.list()
        self.assertEqual(len(listing), 2)
        _, uids, _ = p.uidl()
        self.assertEqual(len({u.split()[1] for u in uids}), 2)

        _, lines, octets = p.retr(1)
        got = b'\r\n'.join(lines) + b'\r\n'
        header, body = split_message(got)
        sent_header, sent_body = split_message(first)
        self.assertEqual(body, sent_body)
        self.assertEqual([h for h in header if h in sent_header], sent_header)
        self.assertIn(b'X-RCPT-TO: alice', header)

        _, top, _ = p.top(1, 0)
        self.assertEqual(top[-1], b'')  # the header's empty line, then the end
        self.assertIn(b'Subject: first one', top)
        _, top2, _ = p.top(1, 2)
        self.assertEqual(top2[-2:], [b'Hello Alice.', b'.a line that starts with a dot'])

        p.dele(1)
        self.assertEqual(p.rset(), b'+OK 2 ' + str(sum(int(x.split()[1]) for x in listing)).encode())
        p.dele(1)
        self.assertEqual(p.stat()[0], 1)
        bye = p.quit()
        self.assertTrue(bye.startswith(b'+OK '), bye)
        self.assertIn(b'Velmor POP3 server (2.0.49) shutdown (1 messages left)', bye)

        with open(self.inbox, 'rb') as f:
            stored = f.read()
        self.assertNotIn(b'first one', stored)
        self.assertIn(b'second one', stored)
        with open(os.path.join(self.home, 'mail', 'overview', 'inbox'), 'rb') as f:
            self.assertEqual(f.read().count(b'#msg\n'), 1)
        p2 = self.pop()
        self.assertEqual(p2.stat()[0], 1)
        self.assertIn(b'Subject: second one', p2.retr(1)[1])
        # The identifier survives, so a client that remembers it skips it.
        self.assertEqual(p2.uidl(1).split()[2], uids[1].split()[1])

    def test_dropped_session_deletes_nothing_and_the_box_is_used_once(self):
        self.send(make_message('keep me'), make_message('me too'))
        first = self.pop()
        first.dele(1)
        with self.assertRaises(poplib.error_proto) as refused:
            self.pop()
        self.assertEqual(str(refused.exception),
                         str(b'-ERR [IN-USE] mailbox already in use: another POP or IMAP session is currently active'))
        first.close()  # gone without QUIT
        again = self.pop_when_free()
        self.assertEqual(again.stat()[0], 2)
        again.quit()
        self.assertEqual(self.delivered(), 2)

    def test_one_login_per_session(self):
        self.send(make_message('mine'))
        s, f, talk = self.raw()
        talk(b'USER alice')
        self.assertEqual(talk(b'PASS ' + PASSWORD.encode()), [b'+OK 1 messages waiting for alice\r\n'])
        # Neither a second PASS nor another user can take over the session.
        self.assertEqual(talk(b'PASS ' + PASSWORD.encode()), [IN_SESSION])
        self.assertEqual(talk(b'USER demo'), [IN_SESSION])
        self.assertEqual(talk(b'STAT')[0][:6], b'+OK 1 ')
        f.close()
        s.close()
        self.assertEqual(self.pop_when_free().stat()[0], 1)  # the mark went with the connection

    def test_mail_arriving_during_a_session_waits_for_the_next(self):
        self.send(make_message('early'))
        p = self.pop()
        self.assertEqual(p.stat()[0], 1)
        self.send(make_message('late'))
        self.assertEqual(p.stat()[0], 1)
        p.dele(1)
        p.quit()
        p = self.pop_when_free()
        self.assertEqual(p.stat()[0], 1)
        self.assertIn(b'Subject: late', p.retr(1)[1])


class BadInput(MailSuite):
    def test_refusals_and_recovery(self):
        self.send(make_message('only'))
        s, f, talk = self.raw()
        invalid_first = b'-ERR Invalid command; valid commands:  USER,  QUIT\r\n'
        self.assertEqual(talk(b'STAT'), [invalid_first])
        self.assertEqual(talk(b'RETR 1'), [invalid_first])
        self.assertEqual(talk(b'PASS x'), [invalid_first])  # PASS without USER
        self.assertEqual(talk(b'USER alice'), [b'+OK please send PASS command\r\n'])
        self.assertEqual(talk(b'LIST'), [b'-ERR Invalid command; valid commands:  USER, PASS, QUIT\r\n'])
        bad = [BAD_LOGIN]
        self.assertEqual(talk(b'USER alice') + talk(b'PASS wrong'), [b'+OK please send PASS command\r\n'] + bad)
        self.assertEqual(talk(b'USER nobody-here') + talk(b'PASS ' + PASSWORD.encode()),
                         [b'+OK please send PASS command\r\n'] + bad)
        self.assertEqual(talk(b'USER ' + b'a' * 200) + talk(b'PASS ' + PASSWORD.encode()),
                         [b'+OK please send PASS command\r\n'] + bad)
        self.assertEqual(f.readline(), b'')  # the third failure ends the connection
        s, f, talk = self.raw()
        self.assertEqual(talk(b'X' * 1000), [b'-ERR Bad command - too long\r\n'])
        self.assertEqual(talk(b'NOOP'), [b'+OK\r\n'])
        # A line longer than the input buffer is refused once, as a whole.
        self.assertEqual(talk(b'USER ' + b'b' * 200000), [b'-ERR Bad command - too long\r\n'])
        self.assertEqual(talk(b'NOOP'), [b'+OK\r\n'])
        # A line end split between two packets is still one line end.
        s.sendall(b'NOOP\r')
        self.assertEqual(f.readline(), b'+OK\r\n')  # so the LF comes in a read of its own
        self.assertEqual(talk(b'\nNOOP'), [b'+OK\r\n'])

        # The other forms of the name the user database knows.
        self.assertEqual(talk(b'USER alice.liddell')[0], b'+OK please send PASS command\r\n')
        self.assertEqual(talk(b'PASS ' + PASSWORD.encode()), [b'+OK 1 messages waiting for alice\r\n'])
        self.assertEqual(talk(b'RETR 2'), [b'-ERR message does not exist or has been deleted\r\n'])
        self.assertEqual(talk(b'LIST 9'), [b'-ERR no such message\r\n'])
        self.assertEqual(talk(b'TOP 1'), [b"-ERR syntax is `TOP <msg no> <lines>', eg. TOP 1 7\r\n"])
        self.assertEqual(talk(b'DELE 1'), [b'+OK message 1 deleted\r\n'])
        self.assertEqual(talk(b'RETR 1'), [b'-ERR message does not exist or has been deleted\r\n'])
        self.assertEqual(talk(b'UIDL 1'), [b'-ERR no such message\r\n'])
        self.assertEqual(talk(b'STAT'), [b'+OK 0 0\r\n'])
        # A ten-letter verb throws the rest of the pipelined input away.
        s.sendall(b'ABCDEFGHIJ\r\nNOOP\r\nNOOP\r\n')
        self.assertEqual(f.readline(), b'-ERR Bad command - too long\r\n')
        self.assertEqual(talk(b'RSET')[0][:4], b'+OK ')
        self.assertTrue(talk(b'QUIT')[0].endswith(b'shutdown (1 messages left)\r\n'))
        self.assertEqual(self.delivered(), 1)

    def test_initials_login_and_pipelined_retrieval(self):
        self.send(*[make_message('piped %d' % i) for i in range(5)])
        s, f, talk = self.raw()
        s.sendall(b'USER a.liddell\r\nPASS ' + PASSWORD.encode() + b'\r\n' +
                  b''.join(b'RETR %d\r\n' % i for i in range(1, 6)) + b'QUIT\r\n')
        data = b''
        s.settimeout(10)
        while True:
            chunk = s.recv(65536)
            if not chunk:
                break
            data += chunk
        self.assertIn(b'+OK 5 messages waiting for alice\r\n', data)
        for i in range(5):
            self.assertIn(b'Subject: piped %d\r\n' % i, data)
        self.assertEqual(data.count(b'\r\n.\r\n'), 5)
        self.assertTrue(data.endswith(b'shutdown (5 messages left)\r\n'))


class PasswordGuessing(MailSuite):
    config = {'store.state': '0'}

    def test_failures_are_answered_late_logged_and_the_third_ends_the_connection(self):
        s, f, talk = self.raw()
        start = time.monotonic()
        talk(b'USER alice')
        s.sendall(b'PASS guess-1\r\n')
        # While that answer waits, another client is served.
        _, _, other = self.raw()
        self.assertEqual(other(b'NOOP'), [b'+OK\r\n'])
        self.assertEqual(select.select([s], [], [], 0)[0], [])  # still waiting
        self.assertEqual(f.readline(), BAD_LOGIN)
        self.assertEqual(talk(b'USER alice') + talk(b'PASS guess-2'), [b'+OK please send PASS command\r\n', BAD_LOGIN])
        self.assertEqual(talk(b'USER bert') + talk(b'PASS guess-3'), [b'+OK please send PASS command\r\n', BAD_LOGIN])
        self.assertEqual(f.readline(), b'')
        self.assertGreaterEqual(time.monotonic() - start, 2.9)  # a second per failure
        log = self.suite.log('main')
        self.assertEqual(log.count('Login failed for: alice from 127.0.0.1'), 2, log)
        self.assertIn('Login failed for: bert from 127.0.0.1', log)
        self.assertNotIn('guess-', log)


class PeerLists(unittest.TestCase):
    def test_a_blocked_peer_is_refused_unless_allowed(self):
        suite = Suite(config={'pop.block': '127.0.0.0/8'})
        self.addCleanup(suite.cleanup)
        suite.start()
        with socket.create_connection(('127.0.0.1', suite.port('pop')), timeout=10) as c:
            self.assertEqual(c.makefile('rb').read(), b'-ERR Connection refused\r\n')
        set_keys(suite.path('config/master'), {'pop.allow': '127.0.0.1'})
        suite.ctl('reload config')
        suite.ctl('test')  # requests are served in order: the reload is done
        self.assertTrue(poplib.POP3('127.0.0.1', suite.port('pop'), timeout=10).quit().startswith(b'+OK '))


class OtherClients(MailSuite):
    def test_capa_fetchmail_and_curl(self):
        # Copying a message is not reading it: no read receipt goes out.
        self.send(make_message('for fetchmail', extra=b'X-Read-Receipt: yes\r\n'), make_message('second for fetchmail'))
        port = str(self.suite.port('pop'))
        p = poplib.POP3('127.0.0.1', self.suite.port('pop'), timeout=10)
        self.assertEqual(p.capa(), {'USER': [], 'STLS': [], 'UIDL': [], 'TOP': [], 'PIPELINING': [],
                                    'RESP-CODES': [],
                                    'IMPLEMENTATION': ['Velmor-Server-Suite-2.0.49']})
        p.quit()
        url = 'pop3://alice:%s@127.0.0.1:%s' % (PASSWORD, port)
        listing = subprocess.run(['curl', '-sS', '--max-time', '10', url + '/'], capture_output=True, timeout=20)
        self.assertEqual(listing.returncode, 0, listing.stderr)
        self.assertEqual(len(listing.stdout.splitlines()), 2)
        one = subprocess.run(['curl', '-sS', '--max-time', '10', url + '/1'], capture_output=True, timeout=20)
        self.assertEqual(one.returncode, 0, one.stderr)
        self.assertIn(b'Subject: for fetchmail', one.stdout)
        self.assertIn(b'\r\n\r\n' + BODY, one.stdout)

        if not shutil.which('fetchmail'):
            self.skipTest('fetchmail is not installed')
        work = tempfile.mkdtemp(prefix='velmor-fetchmail-')
        self.addCleanup(shutil.rmtree, work, True)
        out = os.path.join(work, 'delivered')
        rc = os.path.join(work, 'fetchmailrc')
        with open(rc, 'w') as f:
            # fetchmail's defaults: it asks for STLS and checks the certificate.
            f.write('set no syslog\npoll 127.0.0.1 protocol POP3 port %s timeout 10\n'
                    '  user "alice" password "%s" is root here\n'
                    '  mda "cat >> %s" sslcertfile "%s" sslcommonname "localhost"\n'
                    % (port, PASSWORD, out, self.suite.path('config/tls/cert.pem')))
        os.chmod(rc, 0o600)
        env = dict(os.environ, HOME=work, FETCHMAILHOME=work)
        r = subprocess.run(['fetchmail', '-f', rc, '--nodetach', '--keep', '-v', '--pidfile',
                            os.path.join(work, 'pid')],
                           capture_output=True, env=env, timeout=60, stdin=subprocess.DEVNULL)
        self.assertEqual(r.returncode, 0, r.stdout.decode(errors='replace') + r.stderr.decode(errors='replace'))
        with open(out, 'rb') as f:
            got = f.read()
        self.assertIn(b'Subject: for fetchmail', got)
        self.assertIn(b'Subject: second for fetchmail', got)
        # fetchmail hands the MDA the message with its dots unstuffed.
        self.assertIn(b'\n.\nFrom here on the body goes on\n', got.replace(b'\r\n', b'\n'))
        for queue in ('mail/in', 'mail/out'):
            self.assertEqual([n for n in os.listdir(self.suite.path(queue)) if not n.startswith('.')], [], queue)


class BesideImap(MailSuite):
    """A desktop collecting over POP3 while a phone idles on the same INBOX
    over IMAP and another client moves a message: nobody is locked out."""

    def imap(self):
        m = imaplib.IMAP4('127.0.0.1', self.suite.port('imap'), timeout=20)
        self.addCleanup(m.sock.close)
        m.login('alice', PASSWORD)
        return m

    @staticmethod
    def untagged(m, word):
        """The next untagged line carrying `word` (the others are skipped)."""
        while True:
            line = m.readline()
            if not line or word in line:
                return line

    def test_fetchmail_collects_while_imap_idles_and_moves(self):
        if not shutil.which('fetchmail'):
            self.skipTest('fetchmail is not installed')
        self.send(*(make_message(s) for s in ('one', 'two', 'three')))
        phone = self.imap()
        phone.select('INBOX')
        phone.send(b'i IDLE\r\n')
        self.assertEqual(phone.readline(), b'+ idling\r\n')
        phone.sock.settimeout(10)
        work = tempfile.mkdtemp(prefix='velmor-fetchmail-')
        self.addCleanup(shutil.rmtree, work, True)
        out, started, moved, mda = (os.path.join(work, n) for n in ('delivered', 'started', 'moved', 'mda'))
        # The delivery agent holds fetchmail inside its POP3 session, after
        # the first message, until the move is done (20 s at most).
        with open(mda, 'w') as f:
            f.write('#!/bin/sh\ncat >> %s\ntouch %s\nn=0\n'
                    'while [ ! -e %s ] && [ $n -lt 400 ]; do sleep 0.05; n=$((n+1)); done\n' % (out, started, moved))
        os.chmod(mda, 0o755)
        rc = os.path.join(work, 'fetchmailrc')
        with open(rc, 'w') as f:
            f.write('set no syslog\npoll 127.0.0.1 protocol POP3 port %d timeout 30\n'
                    '  user "alice" password "%s" is root here fetchall\n'
                    '  mda "%s" sslcertfile "%s" sslcommonname "localhost"\n'
                    % (self.suite.port('pop'), PASSWORD, mda, self.suite.path('config/tls/cert.pem')))
        os.chmod(rc, 0o600)
        env = dict(os.environ, HOME=work, FETCHMAILHOME=work)
        fetch = subprocess.Popen(['fetchmail', '-f', rc, '--nodetach', '--keep', '-v', '--pidfile',
                                  os.path.join(work, 'pid')], stdout=subprocess.PIPE, stderr=subprocess.STDOUT,
                                 env=env, stdin=subprocess.DEVNULL)
        self.addCleanup(fetch.kill)
        self.assertTrue(wait_for(lambda: os.path.exists(started) or fetch.poll() is not None, 30))
        self.assertIsNone(fetch.poll(), fetch.communicate()[0] if fetch.poll() is not None else '')
        # Inside that session another client moves message 2, and the phone hears it.
        mover = self.imap()
        self.assertEqual(mover.select('INBOX')[0], 'OK')
        mover.create('Archive')
        self.assertEqual(mover.uid('MOVE', '2', 'Archive')[0], 'OK')
        self.assertEqual(self.untagged(phone, b'EXPUNGE'), b'* 2 EXPUNGE\r\n')
        open(moved, 'w').close()
        output = fetch.communicate(timeout=60)[0]
        self.assertEqual(fetch.returncode, 0, output.decode(errors='replace'))
        # fetchmail had the three present at its login, the moved one too.
        with open(out, 'rb') as f:
            got = f.read()
        for subject in (b'one', b'two', b'three'):
            self.assertIn(b'Subject: ' + subject + b'\r\n', got.replace(b'\n', b'\r\n').replace(b'\r\r', b'\r'))
        # Deletions at a POP3 QUIT reach the idling phone.
        p = self.pop()
        self.assertEqual(p.stat()[0], 2)
        p.dele(1)
        self.assertIn(b'(1 messages left)', p.quit())
        self.assertEqual(self.untagged(phone, b'EXPUNGE'), b'* 1 EXPUNGE\r\n')
        phone.send(b'DONE\r\n')
        self.assertEqual(self.untagged(phone, b'i '), b'i OK IDLE terminated\r\n')


class Faults(MailSuite):
    def test_kill_during_expunge_leaves_a_whole_mailbox(self):
        self.send(make_message('small'))
        self.suite.stop()
        # A mailbox big enough that rewriting it takes a while.
        with open(self.inbox, 'rb') as f:
            one = f.read()
        filler = b'x' * 998 + b'\r\n'
        body_at = one.index(b'\r\n\r\n') + 4
        bigs = [one[:body_at].replace(b'Subject: small', b'Subject: big').replace(b'X-UID: 1', b'X-UID: %d' % (i + 2)) +
                filler * 1000 + one[body_at:] for i in range(12)]
        old = one + b''.join(bigs)
        new = b''.join(bigs)
        with open(self.inbox, 'wb') as f:
            f.write(old)
        os.remove(os.path.join(self.home, 'mail', 'overview', 'inbox'))
        self.suite.start()
        s, f, talk = self.raw()
        talk(b'USER alice')
        self.assertEqual(talk(b'PASS ' + PASSWORD.encode()), [b'+OK 13 messages waiting for alice\r\n'])
        self.assertEqual(talk(b'DELE 1'), [b'+OK message 1 deleted\r\n'])
        s.sendall(b'QUIT\r\n')
        # Killed once the rewrite has begun (its new file exists) or is done.
        self.assertTrue(wait_for(lambda: os.path.exists(self.inbox + '~') or os.path.getsize(self.inbox) != len(old),
                                 10, interval=0.001))
        self.suite.proc.send_signal(signal.SIGKILL)
        self.suite.proc.wait(timeout=10)
        with open(self.inbox, 'rb') as f:
            after = f.read()
        self.assertIn(after, (old, new))
        os.remove(self.suite.pid_file)
        self.suite.start()
        p = self.pop()
        self.assertEqual(p.stat()[0], 13 if after == old else 12)


if __name__ == '__main__':
    unittest.main()

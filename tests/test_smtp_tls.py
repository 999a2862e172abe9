"""SMTP over TLS with real clients: STARTTLS on the SMTP and submission
ports, TLS from the first byte on smtps, AUTH PLAIN and LOGIN, and relaying
for an authenticated user.

Loopback is not the site's network here (smtp.allow names another peer),
so only AUTH lets a client relay. Debatching is left to the tests
(mail.debatch.time 0): a relayed message is debatched on demand into the
outgoing queue, where its Received line is read.
"""
import base64
import os
import re
import smtplib
import ssl
import subprocess
import unittest

from harness import VELMOR_BIN, Suite, wait_for
from test_smtp import Conversation

PASSWORD = 'Tr0ub4dor&3'
CONFIG = {'mail.debatch.time': '0', 'mail.domains': 'localhost, site.example', 'smtp.allow': '192.0.2.1'}
MESSAGE = 'From: ann@site.example\r\nSubject: %s\r\n\r\nbody\r\n'


def numbered(suite, folder):
    d = suite.path(folder)
    return sorted((os.path.join(d, n) for n in os.listdir(d) if n.isdigit()), key=lambda p: int(os.path.basename(p)))


def read(path):
    with open(path, 'rb') as f:
        return f.read()


def make_suite(config):
    """A suite with ann (the default group, which may send) and bob (a group
    that may not); not started."""
    suite = Suite(config=dict(CONFIG, **config))
    with open(suite.path('config/groups'), 'a') as f:
        f.write('#5\n%group.name: Receive only\n%mail.smtp.send: no\n')
    for name, group in (('ann', '0'), ('bob', '5')):
        Suite._run([VELMOR_BIN, '--root', suite.root, '--adduser', name, '--password', PASSWORD,
                    '--home', suite.path('home/' + name), '--group', group])
    with open(suite.path('config/master')) as f:
        suite.host = re.search(r'^%server\.name:\s*(\S+)', f.read(), re.M).group(1)
    suite.cert = suite.path('config/tls/cert.pem')
    return suite


def client_context(suite):
    """Trusts the suite's certificate; Python's SMTP classes check the name
    they connected to (127.0.0.1), which the certificate does not carry."""
    context = ssl.create_default_context(cafile=suite.cert)
    context.check_hostname = False
    return context


class TlsDialogue(Conversation):
    """A raw SMTP connection that can go over to TLS."""

    def __init__(self, suite, service):
        self.suite = suite
        super().__init__(suite.port(service))

    def lines(self):
        """One reply, all its lines."""
        out = [self.line()]
        while out[-1][3:4] == '-':
            out.append(self.line())
        return out

    def secure(self):
        self.sock = ssl.create_default_context(cafile=self.suite.cert).wrap_socket(
            self.sock, server_hostname=self.suite.host)



class SmtpTlsTest(unittest.TestCase):
    """One suite for the whole class: each test leaves it as it found it."""

    @classmethod
    def setUpClass(cls):
        cls.suite = make_suite({})
        cls.suite.start()

    @classmethod
    def tearDownClass(cls):
        cls.suite.cleanup()

    def s_client(self, service, *extra, commands='EHLO client.example\nQUIT\n'):
        out = subprocess.run(['openssl', 's_client', '-connect', '127.0.0.1:%d' % self.suite.port(service),
                              '-CAfile', self.suite.cert, '-servername', self.suite.host,
                              '-verify_hostname', self.suite.host, '-verify_return_error', '-crlf', '-ign_eof',
                              *extra], input=commands, capture_output=True, text=True, timeout=30)
        self.assertEqual(out.returncode, 0, out.stdout + out.stderr)
        return out.stdout

    def debatched(self, marker):
        """The outgoing queue file holding `marker`, after debatching."""
        found = []

        def outgoing():
            self.suite.ctl('maildebatch')
            found[:] = [read(p) for p in numbered(self.suite, 'mail/out') if marker in read(p)]
            return found

        self.assertTrue(wait_for(outgoing, timeout=15), marker)
        return found[0]

    def test_openssl_starttls_on_smtp_and_tls_from_the_first_byte_on_smtps(self):
        # What the session said once TLS was up: no STARTTLS, AUTH now.
        dialogue = self.s_client('smtp', '-starttls', 'smtp').split('\n250-', 1)[1]
        self.assertIn('\n250 AUTH PLAIN LOGIN\n221 ', dialogue)
        self.assertNotIn('STARTTLS', dialogue)
        dialogue = self.s_client('smtps')
        self.assertRegex(dialogue, r'\n220 \S+ Velmor Server Suite SMTP Server')
        self.assertIn('\n250 AUTH PLAIN LOGIN\n221 ', dialogue)
        self.assertNotIn('STARTTLS', dialogue)

    def test_curl_relays_for_an_authenticated_user_on_submission_and_smtps(self):
        for scheme, service, subject in (('smtp', 'submission', 'curl starttls'), ('smtps', 'smtps', 'curl smtps')):
            port = self.suite.port(service)
            out = subprocess.run(
                ['curl', '-sS', '--max-time', '20', '--ssl-reqd', '--cacert', self.suite.cert,
                 '--resolve', '%s:%d:127.0.0.1' % (self.suite.host, port),
                 '%s://%s:%d/client.example' % (scheme, self.suite.host, port), '--user', 'ann:' + PASSWORD,
                 '--mail-from', 'ann@site.example', '--mail-rcpt', 'friend@far.example', '--upload-file', '-'],
                input=MESSAGE % subject, capture_output=True, text=True, timeout=30)
            self.assertEqual(out.returncode, 0, out.stdout + out.stderr)
            data = self.debatched(b'Subject: ' + subject.encode())
            self.assertIn(b'RCPT TO:<friend@far.example>', data)
            self.assertRegex(data, rb'\r\nReceived: from 127\.0\.0\.1 \(authenticated as ann\)\r\n\tby \S+ with ESMTPSA ')

    def test_smtplib_starttls_and_smtp_ssl_log_in_and_a_group_that_may_not_send_may_not_relay(self):
        with smtplib.SMTP('127.0.0.1', self.suite.port('smtp'), timeout=10) as c:
            c.starttls(context=client_context(self.suite))
            c.ehlo()
            self.assertEqual(c.esmtp_features['auth'], ' PLAIN LOGIN')
            self.assertNotIn('starttls', c.esmtp_features)
            c.login('ann', PASSWORD)
            self.assertEqual(c.sendmail('ann@site.example', ['pal@far.example'], MESSAGE % 'smtplib starttls'), {})
        with smtplib.SMTP_SSL('127.0.0.1', self.suite.port('smtps'), timeout=10,
                              context=client_context(self.suite)) as c:
            self.assertEqual(c.mail('bob@far.example'), (530, b'5.7.0 Authentication required'))
            c.login('bob', PASSWORD)
            with self.assertRaises(smtplib.SMTPRecipientsRefused) as refused:
                c.sendmail('bob@far.example', ['pal@far.example'], MESSAGE % 'bob')
            self.assertEqual(refused.exception.recipients['pal@far.example'],
                             (550, b'Posting to this address forbidden'))
        data = self.debatched(b'Subject: smtplib starttls')
        self.assertIn(b'(authenticated as ann)', data)

    def test_submission_wants_starttls_then_auth_and_drops_what_was_pipelined_in_the_clear(self):
        d = TlsDialogue(self.suite, 'submission')
        d.sock.sendall(b'EHLO client.example\r\n')
        features = d.lines()
        self.assertEqual(features[-1], '250 STARTTLS')
        self.assertNotIn('AUTH', ' '.join(features))
        plain = base64.b64encode(b'\0ann\0' + PASSWORD.encode()).decode()
        self.assertEqual(d.cmd('AUTH PLAIN ' + plain), '530 5.7.0 Must issue a STARTTLS command first')
        self.assertEqual(d.cmd('MAIL FROM:<ann@site.example>'), '530 5.7.0 Must issue a STARTTLS command first')
        # The MAIL in the same write as STARTTLS is never answered.
        d.sock.sendall(b'STARTTLS\r\nMAIL FROM:<x@far.example>\r\n')
        self.assertEqual(d.line(), '220 2.0.0 Ready to start TLS')
        self.assertEqual(d.buf, b'')
        d.secure()
        self.assertEqual(d.cmd('MAIL FROM:<ann@site.example>'), '503 5.5.1 Send EHLO first')
        d.sock.sendall(b'EHLO client.example\r\n')
        self.assertEqual(d.lines()[-1], '250 AUTH PLAIN LOGIN')
        self.assertEqual(d.cmd('MAIL FROM:<ann@site.example>'), '530 5.7.0 Authentication required')
        d.sock.close()


class CredentialsTest(unittest.TestCase):
    """swaks logs in with PLAIN and LOGIN, right and wrong, while every log
    facility is on; no log holds a password or its base64 form."""

    def test_swaks_plain_and_login_and_no_log_holds_a_credential(self):
        suite = make_suite({'store.state': str(0x7fffffff & ~0x40000000)})
        self.addCleanup(suite.cleanup)
        suite.start()

        def swaks(mechanism, password, subject):
            return subprocess.run(['swaks', '--server', '127.0.0.1', '--port', str(suite.port('smtp')), '--tls',
                                   '--auth', mechanism, '--auth-user', 'ann', '--auth-password', password,
                                   '--from', 'ann@site.example', '--to', 'pal@far.example',
                                   '--header', 'Subject: ' + subject],
                                  capture_output=True, text=True, timeout=30)

        for mechanism in ('PLAIN', 'LOGIN'):
            good = swaks(mechanism, PASSWORD, 'swaks ' + mechanism)
            self.assertEqual(good.returncode, 0, good.stdout + good.stderr)
            self.assertIn('235 2.7.0 Authentication successful', good.stdout)
            bad = swaks(mechanism, 'wrong-' + PASSWORD, 'refused')
            self.assertNotEqual(bad.returncode, 0)
            self.assertIn('535 5.7.8 Authentication credentials invalid', bad.stdout)
        suite.stop()  # every buffered log line is written out
        secrets = [PASSWORD, 'wrong-' + PASSWORD]
        secrets += [base64.b64encode(p.encode()).decode() for p in secrets]
        secrets += [base64.b64encode(b'\0ann\0' + p.encode()).decode() for p in secrets[:2]]
        logs = ''
        for folder, _, names in os.walk(suite.path('logs')):
            for name in names:
                with open(os.path.join(folder, name), encoding='latin-1') as f:
                    logs += f.read()
        for secret in secrets:
            self.assertNotIn(secret, logs)
        self.assertEqual(logs.count('SMTP: Login failed for: ann from 127.0.0.1'), 2, logs)


if __name__ == '__main__':
    unittest.main()

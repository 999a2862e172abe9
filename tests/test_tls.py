"""POP3 and IMAP over TLS with real clients (openssl s_client, curl, Python's
poplib/imaplib/ssl, fetchmail, mbsync): from the first byte on pops/imaps
and upgraded with STLS/STARTTLS; bytes pipelined behind the upgrade, broken
and stalled handshakes; the certificate renewed by "reload config" and a
missing one."""

import hashlib
import imaplib
import os
import poplib
import shutil
import smtplib
import socket
import ssl
import subprocess
import tempfile
import unittest

from harness import Suite, VELMOR_BIN, wait_for

DOMAIN = 'example.test'
PASSWORD = 'tls-sesame-17'
WRONG = 'not-the-password-93'
NAME = 'localhost'  # one of the names of the certificate --init makes


def message(subject):
    return ('From: bob@elsewhere.test\r\nTo: alice@%s\r\nSubject: %s\r\n\r\nbody of %s\r\n'
            % (DOMAIN, subject, subject)).encode()


def run(args, stdin=b'', timeout=30, env=None):
    return subprocess.run(args, input=stdin, capture_output=True, timeout=timeout, env=env)


def recv_until(sock, marker, timeout=10):
    """What the socket delivers until `marker` has come (or the peer closed)."""
    sock.settimeout(timeout)
    got = b''
    while marker not in got:
        try:
            part = sock.recv(65536)
        except ConnectionResetError:  # closed with our bytes unread
            break
        if not part:
            break
        got += part
    return got


def make_suite(config=None):
    suite = Suite(config=dict({'mail.domains': DOMAIN, 'pops.sock.timeout': '2',
                               'store.state': '65534'}, **(config or {})))
    Suite._run([VELMOR_BIN, '--root', suite.root, '--adduser', 'alice', '--password', PASSWORD,
                '--full-name', 'Alice Liddell', '--home', suite.path('home/alice')])
    suite.start()
    return suite


class TlsMail(unittest.TestCase):
    """One suite for the class: alice with two messages."""

    @classmethod
    def setUpClass(cls):
        cls.suite = make_suite()
        cls.cert = cls.suite.path('config/tls/cert.pem')
        inbox = cls.suite.path('home/alice/mail/inbox')
        with smtplib.SMTP('127.0.0.1', cls.suite.port('smtp'), timeout=10) as smtp:
            for subject in ('first over tls', 'second over tls'):
                smtp.sendmail('bob@elsewhere.test', ['alice@' + DOMAIN], message(subject))

        def delivered():
            cls.suite.ctl('maildebatch')
            try:
                with open(inbox, 'rb') as f:
                    return b'second over tls' in f.read()
            except FileNotFoundError:
                return False
        if not wait_for(delivered, timeout=15):
            cls.suite.cleanup()
            raise RuntimeError('not delivered')

    @classmethod
    def tearDownClass(cls):
        cls.suite.stop()
        cls.suite.cleanup()

    def context(self, check_hostname=True):
        ctx = ssl.create_default_context(cafile=self.cert)
        ctx.check_hostname = check_hostname
        return ctx

    def port(self, name):
        return self.suite.port(name)

    def workdir(self, tool):
        """A scratch folder for `tool`, or the test is skipped without it."""
        if not shutil.which(tool):
            self.skipTest('%s is not installed' % tool)
        work = tempfile.mkdtemp(prefix='velmor-%s-' % tool)
        self.addCleanup(shutil.rmtree, work, True)
        return work

    def s_client(self, port, starttls=None, commands=b''):
        args = ['openssl', 's_client', '-connect', '127.0.0.1:%d' % port, '-CAfile', self.cert,
                '-servername', NAME, '-verify_hostname', NAME, '-verify_return_error', '-quiet', '-ign_eof']
        if starttls:
            args += ['-starttls', starttls]
        r = run(args, commands)
        self.assertEqual(r.returncode, 0, r.stderr.decode(errors='replace'))
        return r.stdout

    # ---- clients ------------------------------------------------------------
    def test_openssl_s_client_implicit_and_upgraded(self):
        pop = b'USER alice\r\nPASS ' + PASSWORD.encode() + b'\r\nSTAT\r\nCAPA\r\nQUIT\r\n'
        for port, starttls in ((self.port('pops'), None), (self.port('pop'), 'pop3')):
            out = self.s_client(port, starttls, pop)
            self.assertIn(b'+OK 2 messages waiting for alice\r\n', out)
            self.assertIn(b'\r\nUSER\r\n', out)
            self.assertNotIn(b'STLS', out)  # encrypted already
            self.assertIn(b' shutdown (2 messages left)\r\n', out)
        imap = b'a CAPABILITY\r\nb LOGIN alice ' + PASSWORD.encode() + b'\r\nc SELECT INBOX\r\nd LOGOUT\r\n'
        for port, starttls in ((self.port('imaps'), None), (self.port('imap'), 'imap')):
            out = self.s_client(port, starttls, imap)
            self.assertIn(b'a OK CAPABILITY completed', out)
            self.assertNotIn(b'STARTTLS', out)
            self.assertIn(b'* 2 EXISTS\r\n', out)
            self.assertIn(b'd OK LOGOUT completed', out)

    def test_curl_with_required_tls_and_from_the_first_byte(self):
        for scheme, service, tls in (('pop3', 'pop', '--ssl-reqd'), ('pop3s', 'pops', None),
                                     ('imap', 'imap', '--ssl-reqd'), ('imaps', 'imaps', None)):
            url = '%s://%s:%d/' % (scheme, NAME, self.port(service))
            url += 'INBOX;UID=2' if scheme.startswith('imap') else '2'
            args = ['curl', '-sS', '--max-time', '10', '--cacert', self.cert, '--user', 'alice:' + PASSWORD, url]
            if tls:
                args.insert(1, tls)
            r = run(args)
            self.assertEqual(r.returncode, 0, (scheme, r.stderr))
            self.assertIn(b'Subject: second over tls', r.stdout, scheme)

    def test_python_clients_implicit_and_upgraded(self):
        # poplib and imaplib cannot be given a name apart from the address they
        # connect to; the chain is checked, the name by the other clients.
        ctx = self.context(check_hostname=False)
        for pop in (poplib.POP3_SSL('127.0.0.1', self.port('pops'), timeout=10, context=ctx),
                    poplib.POP3('127.0.0.1', self.port('pop'), timeout=10)):
            if not isinstance(pop, poplib.POP3_SSL):
                self.assertIn('STLS', pop.capa())
                self.assertTrue(pop.stls(ctx).startswith(b'+OK Begin TLS negotiation'))
            self.assertNotIn('STLS', pop.capa())
            pop.user('alice')
            pop.pass_(PASSWORD)
            self.assertIn(b'Subject: first over tls', pop.retr(1)[1])
            pop.quit()
        for imap in (imaplib.IMAP4_SSL('127.0.0.1', self.port('imaps'), ssl_context=ctx, timeout=10),
                     imaplib.IMAP4('127.0.0.1', self.port('imap'), timeout=10)):
            if not isinstance(imap, imaplib.IMAP4_SSL):
                self.assertIn('STARTTLS', imap.capabilities)
                self.assertEqual(imap.starttls(ctx)[0], 'OK')
            self.assertNotIn('STARTTLS', imap.capabilities)  # asked afresh
            imap.login('alice', PASSWORD)
            imap.select('INBOX', readonly=True)
            _, data = imap.fetch('1', '(BODY.PEEK[HEADER.FIELDS (SUBJECT)])')
            self.assertIn(b'first over tls', data[0][1])
            imap.logout()

    def test_fetchmail_over_pops_and_with_stls(self):
        work = self.workdir('fetchmail')
        for how, port in (('ssl', self.port('pops')), ('', self.port('pop'))):
            out = os.path.join(work, 'delivered' + how)
            rc = os.path.join(work, 'fetchmailrc')
            with open(rc, 'w') as f:
                # The certificate is checked (sslcertck is fetchmail's default);
                # without `ssl` fetchmail asks for STLS by itself.
                f.write('set no syslog\npoll 127.0.0.1 protocol POP3 port %d timeout 10\n'
                        '  user "alice" password "%s" is root here\n'
                        '  mda "cat >> %s" %s sslcertfile "%s" sslcommonname "%s"\n'
                        % (port, PASSWORD, out, how, self.cert, NAME))
            os.chmod(rc, 0o600)
            env = dict(os.environ, HOME=work, FETCHMAILHOME=work)
            r = run(['fetchmail', '-f', rc, '--nodetach', '--keep', '--all', '-v', '--pidfile',
                     os.path.join(work, 'pid')], env=env, timeout=60)
            log = r.stdout.decode(errors='replace') + r.stderr.decode(errors='replace')
            self.assertEqual(r.returncode, 0, log)
            if not how:
                self.assertIn('STLS', log)
            with open(out, 'rb') as f:
                got = f.read()
            self.assertIn(b'Subject: first over tls', got)
            self.assertIn(b'Subject: second over tls', got)

    def test_mbsync_over_imaps_and_with_starttls(self):
        work = self.workdir('mbsync')
        for ssl_type, port in (('IMAPS', self.port('imaps')), ('STARTTLS', self.port('imap'))):
            local = os.path.join(work, ssl_type)
            os.makedirs(local)
            rc = os.path.join(work, 'mbsyncrc-' + ssl_type)
            with open(rc, 'w') as f:
                # A certificate listed in CertificateFile is trusted as it stands.
                f.write('IMAPAccount a\nHost 127.0.0.1\nPort %d\nUser alice\nPass %s\nSSLType %s\n'
                        'CertificateFile %s\n\nIMAPStore remote\nAccount a\n\n'
                        'MaildirStore local\nPath %s/\nInbox %s/inbox\n\n'
                        'Channel c\nFar :remote:\nNear :local:\nPatterns INBOX\nSync Pull\nCreate Near\n'
                        'SyncState *\n' % (port, PASSWORD, ssl_type, self.cert, local, local))
            r = run(['mbsync', '-c', rc, '-a'], timeout=60)
            self.assertEqual(r.returncode, 0, r.stdout + r.stderr)
            fetched = b''
            for folder in ('new', 'cur'):
                for name in os.listdir(os.path.join(local, 'inbox', folder)):
                    with open(os.path.join(local, 'inbox', folder, name), 'rb') as f:
                        fetched += f.read()
            self.assertIn(b'Subject: first over tls', fetched, ssl_type)
            self.assertIn(b'Subject: second over tls', fetched, ssl_type)

    # ---- bad input -------------------------------------------------------------
    def test_commands_pipelined_behind_the_upgrade_are_never_run(self):
        ctx = self.context()
        with socket.create_connection(('127.0.0.1', self.port('pop')), timeout=10) as raw:
            recv_until(raw, b'\r\n')
            raw.sendall(b'STLS\r\nQUIT\r\n')
            self.assertEqual(recv_until(raw, b'\r\n'), b'+OK Begin TLS negotiation\r\n')
            with ctx.wrap_socket(raw, server_hostname=NAME) as tls:
                tls.sendall(b'NOOP\r\n')
                self.assertEqual(recv_until(tls, b'\r\n'), b'+OK\r\n')  # QUIT would have closed it
        with socket.create_connection(('127.0.0.1', self.port('imap')), timeout=10) as raw:
            recv_until(raw, b'\r\n')
            raw.sendall(b'a STARTTLS\r\nb LOGOUT\r\n')
            self.assertEqual(recv_until(raw, b'\r\n'), b'a OK Begin TLS negotiation now\r\n')
            with ctx.wrap_socket(raw, server_hostname=NAME) as tls:
                tls.sendall(b'c NOOP\r\n')
                self.assertEqual(recv_until(tls, b'\r\n'), b'c OK NOOP completed\r\n')
                tls.sendall(b'd LOGOUT\r\n')
                rest = recv_until(tls, b'd OK LOGOUT completed\r\n')
                self.assertNotIn(b'\r\nb ', rest)
                self.assertEqual(rest.count(b'* BYE'), 1)

    def test_broken_and_stalled_handshakes_cost_nothing(self):
        # Half a ClientHello, then gone; garbage; a handshake that never comes.
        hello = b'\x16\x03\x01\x02\x00\x01\x00\x01\xfc\x03\x03' + b'\x00' * 40
        with socket.create_connection(('127.0.0.1', self.port('pops')), timeout=10) as c:
            c.sendall(hello)
        with socket.create_connection(('127.0.0.1', self.port('imaps')), timeout=10) as c:
            c.sendall(b'a LOGIN alice ' + PASSWORD.encode() + b'\r\n' * 50)
            self.assertNotIn(b'OK', recv_until(c, b'never'))  # closed, nothing said in the clear
        stalled = socket.create_connection(('127.0.0.1', self.port('pops')), timeout=10)
        self.addCleanup(stalled.close)
        stalled.sendall(hello[:20])
        stalled.settimeout(30)
        self.assertEqual(stalled.recv(100), b'')  # pops.sock.timeout closes it
        with imaplib.IMAP4_SSL('127.0.0.1', self.port('imaps'), ssl_context=self.context(False), timeout=10) as m:
            self.assertEqual(m.login('alice', PASSWORD)[0], 'OK')

    def test_passwords_reach_no_log_with_every_facility_on(self):
        ctx = self.context(check_hostname=False)
        for password in (PASSWORD, WRONG):
            pop = poplib.POP3('127.0.0.1', self.port('pop'), timeout=10)
            pop.stls(ctx)
            pop.user('alice')
            try:
                pop.pass_(password)
            except poplib.error_proto:
                pass
            pop.quit()
            imap = imaplib.IMAP4_SSL('127.0.0.1', self.port('imaps'), ssl_context=ctx, timeout=10)
            try:
                imap.login('alice', password)
            except imaplib.IMAP4.error:
                pass
            imap.logout()
        self.suite.ctl('test')
        self.assertIn('Login failed for: alice from 127.0.0.1', self.suite.log('main'))
        for top, _, files in os.walk(self.suite.path('logs')):
            for name in files:
                with open(os.path.join(top, name), 'rb') as f:
                    text = f.read()
                for password in (PASSWORD, WRONG):
                    self.assertNotIn(password.encode(), text, name)


class Certificate(unittest.TestCase):
    def fingerprint(self, suite, cafile):
        ctx = ssl.create_default_context(cafile=cafile)
        with socket.create_connection(('127.0.0.1', suite.port('imaps')), timeout=10) as raw:
            with ctx.wrap_socket(raw, server_hostname=NAME) as tls:
                return hashlib.sha256(tls.getpeercert(binary_form=True)).hexdigest()

    def test_reload_config_serves_a_renewed_certificate_to_new_connections(self):
        suite = make_suite()
        self.addCleanup(suite.cleanup)
        cert, key = suite.path('config/tls/cert.pem'), suite.path('config/tls/key.pem')
        with open(cert, 'rb') as f:
            old = hashlib.sha256(ssl.PEM_cert_to_DER_cert(f.read().decode())).hexdigest()
        self.assertEqual(self.fingerprint(suite, cert), old)
        r = run(['openssl', 'req', '-x509', '-newkey', 'ec', '-pkeyopt', 'ec_paramgen_curve:P-256', '-nodes',
                 '-keyout', key + '.new', '-out', cert + '.new', '-days', '2', '-subj', '/CN=' + NAME,
                 '-addext', 'subjectAltName=DNS:' + NAME])
        self.assertEqual(r.returncode, 0, r.stderr)
        os.replace(key + '.new', key)
        os.replace(cert + '.new', cert)
        with open(cert, 'rb') as f:
            new = hashlib.sha256(ssl.PEM_cert_to_DER_cert(f.read().decode())).hexdigest()
        suite.ctl('reload config')
        suite.ctl('test')
        self.assertEqual(self.fingerprint(suite, cert), new)
        self.assertIn('TLS certificate loaded', suite.log('main'))

    def test_a_missing_certificate_leaves_tls_off_and_the_plain_services_running(self):
        suite = make_suite({'tls.cert': 'config/tls/missing.pem'})
        self.addCleanup(suite.cleanup)
        self.assertEqual(suite.log('main').count('TLS certificate not loaded'), 1, suite.log('main'))
        for service in ('pops', 'imaps'):
            with socket.create_connection(('127.0.0.1', suite.port(service)), timeout=10) as c:
                c.settimeout(10)
                try:
                    self.assertEqual(c.recv(100), b'')
                except ConnectionResetError:
                    pass
        pop = poplib.POP3('127.0.0.1', suite.port('pop'), timeout=10)
        self.assertNotIn('STLS', pop.capa())
        with self.assertRaisesRegex(poplib.error_proto, 'TLS is not available'):
            pop._shortcmd('STLS')
        pop.user('alice')
        pop.pass_(PASSWORD)
        pop.quit()
        imap = imaplib.IMAP4('127.0.0.1', suite.port('imap'), timeout=10)
        self.assertNotIn('STARTTLS', imap.capabilities)
        imap.login('alice', PASSWORD)
        imap.logout()


if __name__ == '__main__':
    unittest.main()

"""The SMTP client end to end: a name server written here answers for the
relay host and a direct domain, Postfix's smtp-sink takes the mail on port
25 of 127/8 addresses (and refuses what a case asks it to), and a small
SMTP server written here does what no real server does on request."""

import os
import shutil
import signal
import socket
import subprocess
import tempfile
import time
import unittest

from dns_server import NameServer, response, rr, test_address
from harness import FakeServer, Suite, wait_for

LINK = 0x10000
SINK = shutil.which('smtp-sink') or '/usr/sbin/smtp-sink'


def wait_long(predicate):
    return wait_for(predicate, timeout=20.0)


def queue_text(recipients, body, sender='ann@far.test'):
    head = 'MAIL FROM:<%s>\r\n' % sender + ''.join('RCPT TO:<%s>\r\n' % r for r in recipients)
    return (head + 'DATA\r\n').encode() + body + b'.\r\n'


def as_received(body):
    """What smtp-sink keeps of a stored body: dots unstuffed, LF line ends,
    and a blank line behind."""
    lines = body.split(b'\r\n')[:-1]
    return b''.join((line[1:] if line.startswith(b'.') else line) + b'\n' for line in lines) + b'\n'


class Sink:
    """smtp-sink on port 25 of `address`, keeping each message in a file."""

    def __init__(self, address, *options):
        self.address = address
        self.dir = tempfile.mkdtemp(prefix='velmor-sink-')
        os.chmod(self.dir, 0o777)
        self.proc = subprocess.Popen([SINK, '-u', 'nobody', '-d', self.dir + '/%M.'] + list(options) +
                                     ['%s:25' % address, '50'],
                                     stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
        if not wait_for(self.listening):
            raise RuntimeError('smtp-sink did not start on ' + address)

    def listening(self):
        try:
            socket.create_connection((self.address, 25), timeout=1).close()
            return True
        except OSError:
            return False

    def messages(self):
        out = []
        for name in sorted(os.listdir(self.dir)):
            with open(os.path.join(self.dir, name), 'rb') as f:
                text = f.read()
            # The sink's own header ends with its three-line Received: field.
            at = text.index(b'\nReceived: ')
            out.append(text[text.index(b'\n', text.index(b'\n\t', text.index(b'\n\t', at + 1) + 1) + 1) + 1:])
        return out

    def close(self):
        self.proc.send_signal(signal.SIGTERM)
        try:
            self.proc.wait(5)
        except subprocess.TimeoutExpired:
            self.proc.kill()
            self.proc.wait()
        shutil.rmtree(self.dir, ignore_errors=True)


class SmtpClientTest(unittest.TestCase):
    """One suite and name server for the whole class; each case starts the
    sinks it needs and leaves the queue empty."""

    @classmethod
    def setUpClass(cls):
        cls.ns_address = test_address(1)
        cls.relay = test_address(10)
        cls.mx = test_address(11)
        cls.direct_own = test_address(12)
        cls.ns = NameServer(cls.ns_address, cls.answer)
        cls.suite = Suite(config={
            'dns.servers': cls.ns_address, 'dns.timeout': '1', 'dns.retries': '2',
            'smtp.hosts': 'relay.test', 'smtp.direct': 'direct.test, nxd.test',
            'smtp.time': '0', 'mail.debatch.time': '0', 'server.name': 'suite.test',
            'smtp.allow': '127.0.0.1', 'store.state': '6'})
        try:
            cls.suite.start()
        except Exception:
            cls.ns.close()
            cls.suite.cleanup()
            raise

    @classmethod
    def tearDownClass(cls):
        cls.suite.stop()
        cls.suite.cleanup()
        cls.ns.close()

    @classmethod
    def answer(cls, query):
        name = query.name.lower()
        if name == 'relay.test' and query.type == 1:
            return [(response(query, [rr(query.name, 1, cls.relay, ttl=0)]), None)]
        if name == 'direct.test' and query.type == 15:
            return [(response(query, [rr(query.name, 15, (10, 'mx.direct.test'), ttl=0)]), None)]
        if name == 'direct.test' and query.type == 1:
            return [(response(query, [rr(query.name, 1, cls.direct_own, ttl=0)]), None)]
        if name == 'mx.direct.test' and query.type == 1:
            return [(response(query, [rr(query.name, 1, cls.mx, ttl=0)]), None)]
        return [(response(query, rcode=3), None)]

    def setUp(self):
        self.assertTrue(wait_long(lambda: self.status() & LINK), 'the link never came up')
        self.out = self.suite.path('mail/out')
        self.incoming = self.suite.path('mail/in')

    def tearDown(self):
        for folder in (self.out, self.incoming):
            for name in os.listdir(folder):
                os.unlink(os.path.join(folder, name))
        self.suite.ctl('mailrescan')

    def status(self):
        rc, out = self.suite.ctl('status', raw=True)
        return int(out.split('\n')[0][3:]) if rc == 0 else 0

    def sink(self, address, *options):
        if not os.path.exists(SINK):
            self.skipTest('smtp-sink (package postfix) is not installed')
        s = Sink(address, *options)
        self.addCleanup(s.close)
        return s

    def enqueue(self, *files):
        paths = []
        for text in files:
            SmtpClientTest.serial = getattr(SmtpClientTest, 'serial', 0) + 1
            path = os.path.join(self.out, str(900000 + SmtpClientTest.serial))
            with open(path, 'wb') as f:
                f.write(text)
            paths.append(path)
        self.assertEqual(self.suite.ctl('mailrescan')[0], 0)
        return paths

    def queued(self):
        return sorted(os.listdir(self.out))

    def error_mails(self):
        mails = []
        for name in os.listdir(self.incoming):
            with open(os.path.join(self.incoming, name), 'rb') as f:
                mails.append(f.read())
        return mails

    def client_idle(self):
        return wait_long(lambda: not self.status() & 0x100)

    def runs_ended(self):
        return self.suite.log('main').count('SMTP client run ended: ')

    def kick_and_settle(self):
        before = self.runs_ended()
        self.suite.ctl('smtpkick')
        self.assertTrue(wait_long(lambda: self.runs_ended() > before), 'no SMTP client run ended')
        self.assertTrue(self.client_idle())

    # ---- smtp-sink ----------------------------------------------------------

    def test_relay_and_mail_exchanger_get_each_message_whole(self):
        relay = self.sink(self.relay)
        mx = self.sink(self.mx)
        own = self.sink(self.direct_own)
        bodies = [b'Subject: one\r\n\r\n..starts with a dot\r\n' + b'x' * 990 + b'\r\n\r\nend\r\n',
                  b'Subject: two\r\n\r\n' + b''.join(b'line %d\r\n' % i for i in range(3000))]
        self.enqueue(queue_text(['bob@far.test'], bodies[0]), queue_text(['cat@far.test'], bodies[1]),
                     queue_text(['dan@direct.test'], bodies[0]))
        self.suite.ctl('smtpkick')
        self.assertTrue(wait_long(lambda: not self.queued()), self.queued())
        self.assertTrue(wait_long(lambda: len(relay.messages()) == 2 and len(mx.messages()) == 1))
        self.assertEqual(sorted(relay.messages()), sorted(as_received(b) for b in bodies))
        self.assertEqual(mx.messages(), [as_received(bodies[0])])
        # The domain has a mail exchanger: its own address is never used.
        self.assertEqual(own.messages(), [])
        self.assertTrue(self.ns.asked('direct.test'))
        self.assertTrue(all(q.type == 15 for q in self.ns.asked('direct.test')))
        self.assertEqual(self.error_mails(), [])

    def test_temporary_refusals_keep_and_permanent_ones_return(self):
        text = queue_text(['bob@far.test'], b'Subject: s\r\n\r\nbody\r\n')
        for options in (('-r', 'RCPT'), ('-r', '.')):
            sink = self.sink(self.relay, *options)
            paths = self.enqueue(text)
            self.kick_and_settle()
            with open(paths[0], 'rb') as f:
                self.assertEqual(f.read(), text, options)
            if options[1] != '.':  # the sink keeps what it refuses after the dot
                self.assertEqual(sink.messages(), [], options)
            self.assertEqual(self.error_mails(), [], options)
            sink.close()
            os.unlink(paths[0])
            self.suite.ctl('mailrescan')
        for options in (('-f', 'RCPT'), ('-f', '.')):
            sink = self.sink(self.relay, *options)
            self.enqueue(text)
            self.kick_and_settle()
            self.assertEqual(self.queued(), [], options)
            mails = self.error_mails()
            self.assertEqual(len(mails), 1, options)
            self.assertIn(b'RCPT TO:<ann@far.test>', mails[0])
            self.assertIn(b'SMTP Mail delivery failed.', mails[0])
            self.assertIn(b'500 5.3.0 Error: command failed', mails[0])
            sink.close()
            for name in os.listdir(self.incoming):
                os.unlink(os.path.join(self.incoming, name))

    def test_two_kicks_at_once_make_one_connection(self):
        # The sink waits before answering MAIL, so the first connection is
        # still at work when the second kick comes (without pipelining: the
        # sink answers what follows a delayed command first).
        sink = self.sink(self.relay, '-p', '-W', 'mail:1')
        self.enqueue(*[queue_text(['r%d@far.test' % i], b'Subject: %d\r\n\r\nx\r\n' % i) for i in range(3)])
        before = self.suite.log('main').count('SMTP client connecting to: relay.test')
        self.suite.ctl('smtpkick')
        self.suite.ctl('smtpkick')
        self.assertTrue(wait_long(lambda: not self.queued()))
        self.assertTrue(self.client_idle())
        self.assertEqual(len(sink.messages()), 3)
        self.assertEqual(self.suite.log('main').count('SMTP client connecting to: relay.test') - before, 1)

    def test_a_domain_that_does_not_exist_returns_its_mail_at_once(self):
        self.enqueue(queue_text(['eve@nxd.test'], b'Subject: s\r\n\r\nbody\r\n'))
        self.suite.ctl('smtpkick')
        self.assertTrue(wait_long(lambda: not self.queued()))
        mails = self.error_mails()
        self.assertEqual(len(mails), 1)
        self.assertIn(b'The domain nxd.test does not exist.', mails[0])


class ScriptedServer(FakeServer):
    """An SMTP server on port 25 of `address` that runs `script(conn)` for
    each connection it accepts."""

    def __init__(self, address, script):
        self.script = script
        self.connections = 0
        super().__init__((address, 25))

    def session(self, conn):
        self.connections += 1
        conn.setsockopt(socket.IPPROTO_TCP, socket.TCP_NODELAY, 1)
        self.script(Peer(conn))


class Peer:
    def __init__(self, conn):
        self.conn = conn
        self.buffer = b''

    def say(self, text, pieces=1):
        """Sends `text`, cut into pieces that each go in a packet of its own."""
        step = max(1, len(text) // pieces)
        for at in range(0, len(text), step):
            self.conn.sendall(text[at:at + step])
            if pieces > 1:
                time.sleep(0.02)

    def line(self):
        while b'\r\n' not in self.buffer:
            more = self.conn.recv(65536)
            if not more:
                raise EOFError
            self.buffer += more
        line, self.buffer = self.buffer.split(b'\r\n', 1)
        return line

    def until(self, end):
        while end not in self.buffer:
            more = self.conn.recv(65536)
            if not more:
                raise EOFError
            self.buffer += more
        at = self.buffer.index(end) + len(end)
        data, self.buffer = self.buffer[:at], self.buffer[at:]
        return data


class SmtpClientOddServersTest(SmtpClientTest):
    """The same suite against a server written here."""

    # The smtp-sink cases run once, in the class above.
    test_relay_and_mail_exchanger_get_each_message_whole = None
    test_temporary_refusals_keep_and_permanent_ones_return = None
    test_two_kicks_at_once_make_one_connection = None
    test_a_domain_that_does_not_exist_returns_its_mail_at_once = None

    def serve(self, script):
        server = ScriptedServer(self.relay, script)
        self.addCleanup(server.close)
        return server

    def test_replies_split_across_reads_and_multi_line(self):
        received = []

        def script(peer):
            peer.say(b'220-relay.test hello\r\n220-more greeting\r\n220 ready\r\n', pieces=7)
            received.append(peer.line())
            peer.say(b'250-relay.test\r\n250-SIZE 1000\r\n250 HELP\r\n', pieces=5)
            for _ in range(2):
                received.append(peer.line())
                peer.say(b'250 2.1.0 Ok\r\n', pieces=3)
            received.append(peer.line())
            peer.say(b'354 go on\r\n', pieces=2)
            received.append(peer.until(b'\r\n.\r\n'))
            peer.say(b'250-2.0.0 queued\r\n250 as 1\r\n', pieces=4)
            received.append(peer.line())
            peer.say(b'221 bye\r\n')

        self.serve(script)
        body = b'Subject: raw\r\n\r\n..dot\r\n.\r\nbare\n.\nsmuggled\r\n'
        self.enqueue(queue_text(['bob@far.test'], body))
        self.suite.ctl('smtpkick')
        self.assertTrue(wait_long(lambda: not self.queued() and len(received) == 6))
        self.assertEqual(received[:4], [b'EHLO suite.test', b'MAIL FROM:<ann@far.test>',
                                        b'RCPT TO:<bob@far.test>', b'DATA'])
        # Byte for byte as stored, save the lone dots, which go out doubled.
        self.assertEqual(received[4], b'Subject: raw\r\n\r\n..dot\r\n..\r\nbare\n..\nsmuggled\r\n.\r\n')
        self.assertEqual(received[5], b'QUIT')

    def test_a_421_greeting_or_a_drop_after_data_keeps_the_queue(self):
        def greet_421(peer):
            peer.say(b'421 relay.test busy\r\n')

        def drop_after_data(peer):
            peer.say(b'220 ok\r\n')
            for reply in (b'250 hi\r\n', b'250 ok\r\n', b'250 ok\r\n', b'354 go\r\n'):
                peer.line()
                peer.say(reply)
            peer.until(b'\r\n.\r\n')

        text = queue_text(['bob@far.test'], b'Subject: s\r\n\r\nbody\r\n')
        paths = self.enqueue(text)
        for script in (greet_421, drop_after_data):
            server = ScriptedServer(self.relay, script)
            try:
                self.kick_and_settle()
                self.assertEqual(server.connections, 1)
            finally:
                server.close()
            with open(paths[0], 'rb') as f:
                self.assertEqual(f.read(), text)
            self.assertEqual(self.error_mails(), [])

    def test_turn_sends_the_queue_to_an_allowed_peer(self):
        body = b'Subject: turned\r\n\r\nhello\r\n'
        self.enqueue(queue_text(['bob@far.test'], body))
        with socket.create_connection(('127.0.0.1', self.suite.port('smtp')), timeout=10) as conn:
            peer = Peer(conn)
            self.assertTrue(peer.line().startswith(b'220 '))
            peer.say(b'HELO peer\r\n')
            peer.line()
            peer.say(b'TURN\r\n')
            self.assertEqual(peer.line(), b'250 OK')
            peer.say(b'220 peer.test ready\r\n')
            self.assertEqual(peer.line(), b'EHLO suite.test')
            peer.say(b'250 hi\r\n')
            self.assertEqual(peer.line(), b'MAIL FROM:<ann@far.test>')
            peer.say(b'250 ok\r\n')
            self.assertEqual(peer.line(), b'RCPT TO:<bob@far.test>')
            peer.say(b'250 ok\r\n')
            self.assertEqual(peer.line(), b'DATA')
            peer.say(b'354 go\r\n')
            self.assertEqual(peer.until(b'\r\n.\r\n'), body + b'.\r\n')
            peer.say(b'250 ok\r\n')
            self.assertEqual(peer.line(), b'QUIT')
            peer.say(b'221 bye\r\n')
        self.assertTrue(wait_long(lambda: not self.queued()))


if __name__ == '__main__':
    unittest.main()

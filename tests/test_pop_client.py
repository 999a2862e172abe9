"""The POP3 client end to end: against a POP3 server written here for what
real servers will not do on request (drops, wrong sizes, empty messages, a
refused message), against a private Dovecot (whole messages, deletion, a
full disk), and in the dial-up mail transfer. Fetched mail is delivered to
local users only; the rest lands in oddments."""

import os
import random
import re
import socket
import subprocess
import unittest

import dovecot
from dns_server import NameServer, response, test_address
from fake_modem import FakeModem
from harness import FakeServer, Suite, VELMOR_BIN, wait_for as wait_briefly

RUNNING, ENDED = 0x400, 16  # status bits: a POP3 client runs / a run ended


def wait_for(predicate, timeout=20.0):
    return wait_briefly(predicate, timeout=timeout)


def numbered(folder):
    if not os.path.isdir(folder):
        return []
    return sorted((os.path.join(folder, n) for n in os.listdir(folder) if n.isdigit()),
                  key=lambda p: int(os.path.basename(p)))


def read(path):
    with open(path, 'rb') as f:
        return f.read()


def transmitted(message):
    """A message (LF or CR LF lines) as POP3 carries it and the queue keeps it."""
    lines = message.replace(b'\r\n', b'\n').split(b'\n')
    if lines and lines[-1] == b'':
        lines.pop()
    return b''.join((b'.' + l if l.startswith(b'.') else l) + b'\r\n' for l in lines) + b'.\r\n'


def fetched_message(path):
    """The message part of a fetched queue file (behind its Received trace)."""
    text = read(path)
    assert text.startswith(b'POP3 MAIL FROM:<'), text[:80]
    marker = b' with POP3 (Velmor 2.0.49);\r\n\t'
    date_at = text.index(marker) + len(marker)
    return text[text.index(b'\r\n', date_at) + 2:]


class PopServer(FakeServer):
    """A POP3 server on 127.0.0.1 for one account. `messages` is a list of
    (bytes, how): how is 'ok' ("+OK n octets"), 'bare' ("+OK" alone),
    'wrong' (a size far too small), 'err' (RETR refused), 'drop' (the
    connection is cut half way through the message), 'endless' (a message
    that never ends, listed as small) or 'silent' (half a message, then
    nothing). Each message has its UIDL; deletions apply at QUIT, unless
    `cut_at_quit` (the connection is cut before QUIT's answer and nothing is
    deleted). `short_listings` answers LIST and UIDL with one line, as if
    they were not multi-line. `commands` keeps every command line of every
    session."""

    def __init__(self, messages, pipelining=True):
        self.messages = []
        self.uids = []
        for text, how in messages:
            self.add(text, how)
        self.pipelining = pipelining
        self.cut_at_quit = False
        self.short_listings = False
        self.commands = []
        super().__init__()

    def add(self, text, how='ok'):
        self.messages.append((text, how))
        self.uids.append('uid-%d.%d' % (len(self.uids) + 1, id(self)))

    def listing(self, conn, items):
        if self.short_listings:
            conn.sendall(b'+OK %d messages\r\n' % len(items))
        else:
            conn.sendall(b'+OK\r\n' + b''.join(b'%d %s\r\n' % (n, v) for n, v in enumerate(items, 1)) + b'.\r\n')

    def session(self, conn):
        f = conn.makefile('rb')
        conn.sendall(b'+OK test server ready\r\n')
        deleted = set()
        while True:
            line = f.readline()
            if not line:
                return
            command = line.rstrip(b'\r\n').decode()
            self.commands.append(command)
            verb, _, arg = command.partition(' ')
            verb = verb.upper()
            if verb in ('USER', 'PASS', 'NOOP'):
                conn.sendall(b'+OK\r\n')
            elif verb == 'CAPA':
                conn.sendall(b'+OK\r\nUIDL\r\n' + (b'PIPELINING\r\n' if self.pipelining else b'') + b'.\r\n')
            elif verb == 'STAT':
                conn.sendall(b'+OK %d %d\r\n' % (len(self.messages), sum(len(m) for m, _ in self.messages)))
            elif verb == 'LIST':
                self.listing(conn, [b'%d' % len(m) for m, _ in self.messages])
            elif verb == 'UIDL':
                self.listing(conn, [u.encode() for u in self.uids])
            elif verb == 'RETR':
                text, how = self.messages[int(arg) - 1]
                data = transmitted(text)
                if how == 'endless':
                    conn.sendall(b'+OK 100 octets\r\n' + text)
                    while True:  # until the client hangs up
                        conn.sendall((b'x' * 78 + b'\r\n') * 800)
                elif how == 'silent':
                    conn.sendall(b'+OK\r\n' + data[:len(data) // 2])
                    f.read()  # nothing more, until the client hangs up
                    return
                elif how == 'err':
                    conn.sendall(b'-ERR message locked\r\n')
                elif how == 'drop':
                    conn.sendall(b'+OK %d octets\r\n' % len(text) + data[:len(data) // 2])
                    conn.shutdown(socket.SHUT_RDWR)
                    return
                else:
                    status = {'ok': b'+OK %d octets' % len(text), 'bare': b'+OK', 'wrong': b'+OK 3 octets'}[how]
                    conn.sendall(status + b'\r\n' + data)
            elif verb == 'DELE':
                deleted.add(int(arg))
                conn.sendall(b'+OK deleted\r\n')
            elif verb == 'QUIT':
                if self.cut_at_quit:
                    return
                kept = [n for n in range(len(self.messages)) if n + 1 not in deleted]
                self.messages = [self.messages[n] for n in kept]
                self.uids = [self.uids[n] for n in kept]
                conn.sendall(b'+OK bye\r\n')
                return
            else:
                conn.sendall(b'-ERR unknown\r\n')


def answer_all(query):
    return [(response(query, rcode=3), None)]


class FetchCase(unittest.TestCase):
    """A suite whose link is up (its name server answers), debatching only
    when asked."""

    def start(self, hosts, **keys):
        self.names = NameServer(test_address(40), answer_all)
        self.addCleanup(self.names.close)
        config = {'dns.servers': self.names.address, 'dns.timeout': '1', 'dns.retries': '1',
                  'mail.debatch.time': '0', 'mail.domains': 'site.example', 'server.name': 'site.example',
                  'pop.hosts': hosts, 'store.state': str(2 + 8)}
        config.update(keys)
        self.suite = Suite(config=config)
        self.addCleanup(self.suite.cleanup)
        return self.suite

    def run_suite(self):
        self.suite.start()
        self.assertTrue(wait_for(lambda: self.status() & 0x10000), self.suite.log('main'))

    def status(self):
        rc, out = self.suite.ctl('status', raw=True)
        return int(out.split('\n')[0][3:]) if rc == 0 else 0

    def fetch(self):
        """popkick, then waits for the run to end."""
        self.suite.ctl('clear mqcng')
        self.suite.ctl('popkick')
        self.assertTrue(wait_for(lambda: 'POP client dispose' in self.suite.log('main')), self.suite.log('main'))
        self.assertTrue(wait_for(lambda: not self.status() & RUNNING))

    def queued(self, folder='mail/in'):
        return numbered(self.suite.path(folder))

    def hidden(self, folder='mail/in'):
        d = self.suite.path(folder)
        return [n for n in os.listdir(d) if not n.isdigit()] if os.path.isdir(d) else []


class AwkwardServerTest(FetchCase):

    def serve(self, messages, pipelining=True):
        server = PopServer(messages, pipelining)
        self.addCleanup(server.close)
        self.start('acct:secret@127.0.0.1:%d' % server.port)
        self.run_suite()
        return server

    def test_sizes_do_not_matter_and_a_refused_message_stays(self):
        body = lambda n: b'Subject: m%d\r\n\r\nline\r\n.starts with a dot\r\n+OK looks like a reply\r\n' % n
        messages = [(body(1), 'ok'), (body(2), 'bare'), (body(3) + b'x' * 5000 + b'\r\n', 'wrong'),
                    (b'', 'ok'), (body(5), 'err')]
        server = self.serve(messages, pipelining=False)
        self.fetch()
        files = self.queued()
        self.assertEqual(len(files), 4, self.suite.log('main'))
        # The last message first; each whole, as carried.
        self.assertEqual([fetched_message(p) for p in files],
                         [transmitted(m) for m, how in reversed(messages) if how != 'err'])
        self.assertEqual(server.messages, [messages[4]])  # the refused one is still there
        self.assertEqual([c for c in server.commands if c.startswith('DELE')], ['DELE 4', 'DELE 3', 'DELE 2', 'DELE 1'])
        self.assertEqual(self.hidden(), [])
        self.assertTrue(self.status() & ENDED)

    def test_a_drop_mid_message_leaves_no_file_and_deletes_nothing(self):
        server = self.serve([(b'Subject: one\r\n\r\nbody\r\n', 'ok'), (b'Subject: two\r\n\r\n' + b'y' * 20000, 'drop'),
                             (b'Subject: three\r\n\r\nbody\r\n', 'ok')])
        self.fetch()
        self.assertEqual(len(server.messages), 3)  # no QUIT: nothing deleted
        self.assertNotIn('QUIT', server.commands)
        self.assertEqual(self.hidden(), [])
        for p in self.queued():
            self.assertNotIn(b'Subject: two', read(p))
        # The next run fetches the rest, each message once.
        server.messages[1] = (server.messages[1][0], 'ok')
        self.fetch_again()
        self.assertEqual(self.subjects(), [b'one', b'three', b'two'])
        self.assertEqual(server.messages, [])

    def test_an_endless_message_is_dropped_and_left_and_the_run_goes_on(self):
        server = PopServer([(b'Subject: one\r\n\r\nbody\r\n', 'ok'), (b'Subject: endless\r\n\r\n', 'endless'),
                            (b'Subject: three\r\n\r\nbody\r\n', 'ok')])
        self.addCleanup(server.close)
        self.start('acct:secret@127.0.0.1:%d' % server.port)
        groups = self.suite.path('config/groups')
        with open(groups) as f:
            text = f.read()
        with open(groups, 'w') as f:
            f.write(re.sub(r'(?m)^%mail\.msg\.size: .*$', '%mail.msg.size: 64', text, count=1))
        self.run_suite()
        self.fetch()
        self.assertEqual(self.subjects(), [b'one', b'three'])
        self.assertEqual([m for m, _ in server.messages], [b'Subject: endless\r\n\r\n'])  # left there
        self.assertEqual(self.hidden(), [])
        self.assertIn('POP client - message 2 of acct@127.0.0.1 is over the limit of 65536 bytes: dropped, left on '
                      'the server', self.suite.log('main'))
        # Known from then on: the next run does not ask for it again.
        retrs = server.commands.count('RETR 1')
        self.fetch_again()
        self.assertEqual(server.commands.count('RETR 1'), retrs)
        self.assertEqual(len(self.queued()), 2)

    def test_sessions_cut_before_quits_answer_queue_each_message_once(self):
        server = self.serve([(b'Subject: one\r\n\r\nbody\r\n', 'ok'), (b'Subject: two\r\n\r\nbody\r\n', 'ok')])
        server.cut_at_quit = True  # and the server deletes nothing
        self.fetch()
        self.fetch_again()
        server.add(b'Subject: three\r\n\r\nbody\r\n')
        self.fetch_again()
        self.assertEqual(self.subjects(), [b'one', b'three', b'two'])
        self.assertEqual([c for c in server.commands if c.startswith('RETR')], ['RETR 2', 'RETR 1', 'RETR 3'])
        self.assertEqual(server.commands.count('DELE 1'), 3)
        # Once the server has deleted them, they are forgotten.
        record = [os.path.join(self.suite.path('mail/pop'), n) for n in os.listdir(self.suite.path('mail/pop'))]
        self.assertEqual(len(record), 1)
        self.assertEqual(read(record[0]).split(b'\n')[1:], [u.encode() for u in server.uids] + [b''])
        server.cut_at_quit = False
        self.fetch_again()
        self.assertEqual(server.messages, [])
        self.fetch_again()
        self.assertFalse(os.path.exists(record[0]))
        self.assertEqual(len(self.queued()), 3)

    def subjects(self):
        return sorted(re.search(rb'Subject: (\w+)', read(p)).group(1) for p in self.queued())

    def fetch_again(self):
        log = self.suite.log('main')
        self.suite.ctl('popkick')
        self.assertTrue(wait_for(lambda: self.suite.log('main').count('POP client dispose') > log.count(
            'POP client dispose')))


class SilentServerTest(FetchCase):
    """A server that goes silent half way through a message, and one that
    answers LIST and UIDL with a single line: each connection gives up at
    the time-out and says where it stood."""

    def test_each_gives_up_at_its_time_out_and_logs_it(self):
        silent = PopServer([(b'Subject: one\r\n\r\n' + b'body line\r\n' * 100, 'silent')])
        short = PopServer([(b'Subject: two\r\n\r\nbody\r\n', 'ok')])
        short.short_listings = True
        for server in (silent, short):
            self.addCleanup(server.close)
        self.start('a:x@127.0.0.1:%d, b:y@127.0.0.1:%d' % (silent.port, short.port), **{'pop.sock.timeout': '2'})
        self.run_suite()
        self.suite.ctl('popkick')
        log = lambda: self.suite.log('main')
        self.assertTrue(wait_for(lambda: log().count('POP client dispose') == 2), log())
        self.assertIn('POP client - connection to 127.0.0.1 ended (timed out) after 0 messages, in the middle of '
                      'message 1', log())
        self.assertIn('POP client - connection to 127.0.0.1 ended (timed out) after 0 messages, waiting for the end '
                      'of the answer to LIST', log())
        self.assertEqual(self.queued(), [])
        self.assertEqual(self.hidden(), [])
        self.assertEqual(len(silent.messages) + len(short.messages), 2)


class FetchedMailDeliveryTest(FetchCase):

    def test_fetched_mail_reaches_local_users_only(self):
        server = PopServer([(b'Delivered-To: ann@site.example\r\nSubject: for ann\r\n\r\nhi\r\n', 'ok'),
                            (b'Delivered-To: someone@far.example\r\nSubject: for nobody here\r\n\r\nhi\r\n', 'ok'),
                            (b'Subject: no header at all\r\n\r\nhi\r\n', 'ok')])
        self.addCleanup(server.close)
        self.start('acct:secret@127.0.0.1:%d' % server.port, **{'pop.headers': 'Delivered-To'})
        home = self.suite.path('home/ann')
        Suite._run([VELMOR_BIN, '--root', self.suite.root, '--adduser', 'ann', '--password', 'x', '--home', home])
        self.run_suite()
        self.fetch()
        self.assertEqual(len(self.queued()), 3)
        for _ in range(20):
            if not self.queued():
                break
            self.suite.ctl('maildebatch')
        self.assertTrue(wait_for(lambda: not self.queued()))
        self.assertTrue(wait_for(lambda: len(numbered(self.suite.path('mail/odd'))) == 2), self.suite.log('errors'))
        with open(os.path.join(home, 'mail', 'inbox'), 'rb') as f:
            inbox = f.read()
        self.assertIn(b'Subject: for ann', inbox)
        self.assertNotIn(b'nobody here', inbox)
        self.assertEqual(numbered(self.suite.path('mail/out')), [])
        self.assertEqual(self.suite.log('errors').count('Fetched mail for no local user'), 2)


def dovecot_messages(count, seed):
    rnd = random.Random(seed)
    words = 'fetch queue link modem mail provider header body line dot'.split()
    out = []
    for n in range(1, count + 1):
        lines = [b'From: Sender <s%d@far.example>' % n, b'To: acct@isp.example', b'Subject: number %d' % n,
                 b'Message-ID: <%d.%d@far.example>' % (seed, n), b'']
        for _ in range(rnd.randint(3, 300)):
            lines.append(' '.join(rnd.choice(words) for _ in range(rnd.randint(1, 12))).encode())
        lines[rnd.randint(6, len(lines) - 1)] = b'.'  # a lone dot inside the body
        lines.append(b'..two dots')
        out.append(b'\n'.join(lines) + b'\n')
    return out


@unittest.skipUnless(dovecot.available(), 'dovecot-pop3d is not installed')
class DovecotTest(FetchCase):

    def setUp(self):
        self.dovecot = dovecot.Dovecot()
        self.addCleanup(self.dovecot.close)

    def account(self, user, keep=False):
        return '%s%s:%s@127.0.0.1:%d' % ('-' if keep else '', user, self.dovecot.password, self.dovecot.port)

    def test_fifty_messages_arrive_whole_and_are_deleted_or_kept(self):
        take, keep = dovecot_messages(50, 1), dovecot_messages(50, 2)
        self.dovecot.fill('take', take)
        self.dovecot.fill('keep', keep)
        self.start(self.account('take') + ', ' + self.account('keep', keep=True))
        self.run_suite()
        self.fetch()
        self.assertTrue(wait_for(lambda: self.suite.log('main').count('POP client dispose') == 2))
        self.assertTrue(wait_for(lambda: not self.status() & RUNNING))
        got = {}
        for p in self.queued():
            message = fetched_message(p)
            got.setdefault(re.search(rb'<(\d+)\.(\d+)@far', message).groups(), message)
        self.assertEqual(len(self.queued()), 100)
        for seed, messages in ((1, take), (2, keep)):
            for n, m in enumerate(messages, 1):
                self.assertEqual(got[(b'%d' % seed, b'%d' % n)], transmitted(m), (seed, n))
        self.assertEqual(self.dovecot.left('take'), 0)
        self.assertEqual(self.dovecot.left('keep'), 50)
        self.assertEqual(self.hidden(), [])

    def test_a_full_disk_deletes_nothing_that_is_not_queued(self):
        if os.geteuid() != 0:
            self.skipTest('mounting a small file system needs root')
        self.dovecot.fill('take', dovecot_messages(50, 3))
        suite = self.start(self.account('take'), **{'mail.dir.incoming': 'small/in'})
        small = suite.path('small')
        os.makedirs(small)
        r = subprocess.run(['mount', '-t', 'tmpfs', '-o', 'size=96k,mode=0770', 'velmor-small', small],
                           capture_output=True)
        if r.returncode != 0:
            self.skipTest('cannot mount a tmpfs: %s' % r.stderr.decode(errors='replace'))
        self.addCleanup(subprocess.run, ['umount', '-l', small])
        self.run_suite()
        self.fetch()
        queued = len(self.queued('small/in'))
        left = self.dovecot.left('take')
        self.assertGreater(queued, 0)
        self.assertGreater(left, 0, self.suite.log('main'))
        self.assertEqual(queued + left, 50)  # every deleted message is queued, and nothing twice
        self.assertEqual(self.hidden('small/in'), [])
        self.assertIn('not queued', self.suite.log('errors'))


class MailTransferTest(FetchCase):
    """"mailtransfer" fetches at once with the link up; with it down it dials
    (a modem written here), waits until the name server answers, fetches,
    and hangs up."""

    def test_with_the_link_up(self):
        server = PopServer([(b'Subject: one\r\n\r\nbody\r\n', 'ok')])
        self.addCleanup(server.close)
        self.start('acct:secret@127.0.0.1:%d' % server.port)
        self.run_suite()
        self.suite.ctl('mailtransfer')
        self.assertTrue(wait_for(lambda: server.messages == []), self.suite.log('main'))
        self.assertEqual(len(self.queued()), 1)
        self.assertIn('Internal command: mailtransfer', self.suite.log('main'))
        self.assertNotIn('Mail transfer - connecting...', self.suite.log('main'))

    def test_with_the_link_down_until_the_name_server_answers(self):
        server = PopServer([(b'Subject: one\r\n\r\nbody\r\n', 'ok'), (b'Subject: two\r\n\r\nbody\r\n', 'ok')])
        self.addCleanup(server.close)
        replies = {b'ATZ': b'\r\nOK\r\n', b'ATDT5551234': b'\r\nCONNECT 33600\r\n'}
        modem = FakeModem(replies.get)
        self.addCleanup(modem.hang_up)
        self.link = False
        names = NameServer(test_address(41), lambda q: answer_all(q) if self.link else [])
        self.addCleanup(names.close)
        suite = Suite(config={
            'dialler.driver': 'modem', 'dialler.script': 'config/dial.script', 'dialler.phone': '5551234',
            'dns.servers': names.address, 'dns.timeout': '1', 'dns.retries': '1',
            'mail.debatch.time': '0', 'pop.hosts': 'acct:secret@127.0.0.1:%d' % server.port,
            'store.state': str(2 + 8 + 16384)})
        self.suite = suite
        self.addCleanup(suite.cleanup)
        os.symlink(modem.path, suite.path('modem'))
        with open(suite.path('config/dial.script'), 'w') as f:
            f.write('i ATZ\nd "ATDT%phone"\n')
        suite.start()
        suite.ctl('mailtransfer')
        self.assertTrue(wait_for(lambda: 'Dialler - script complete' in suite.log('main')), suite.log('main'))
        seen = len(names.queries)
        self.assertTrue(wait_for(lambda: len(names.queries) >= seen + 2))  # unanswered probes
        self.assertEqual(len(server.messages), 2)  # nothing fetched while the link is down
        self.link = True
        self.assertTrue(wait_for(lambda: 'Mail transfer complete, disconnecting' in suite.log('main')),
                        suite.log('main') + suite.log('errors') + repr(server.commands))
        self.assertEqual(server.messages, [])
        self.assertEqual(len(self.queued()), 2)
        log = suite.log('main')
        steps = ['Mail transfer - connecting...', 'Dialler - script complete', 'DNS - Network link established',
                 'Mail transfer - connected, and starting transfer', 'POP3 client connected to: 127.0.0.1',
                 'POP client closing connection', 'Mail transfer complete, disconnecting']
        at = [log.find(step) for step in steps]
        self.assertNotIn(-1, at, log)
        self.assertEqual(at, sorted(at), log)


if __name__ == '__main__':
    unittest.main()

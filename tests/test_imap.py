"""Mail kept on the server: SMTP in, maildebatch, and IMAP out, with real
clients (imaplib, curl, mbsync, offlineimap) and with bad input."""

import base64
import email
import imaplib
import os
import poplib
import re
import shutil
import signal
import socket
import subprocess
import tempfile
import time
import unittest

from harness import Suite, VELMOR_BIN, wait_for
from test_pop3 import DOMAIN, MailSuite, make_message, split_message

# A password imaplib sends as a quoted string with escapes.
TRICKY = 'pa"ss\\word'

NESTED = (b'MIME-Version: 1.0\r\n'
          b'Content-Type: multipart/mixed; boundary="outer"\r\n'
          b'\r\n'
          b'--outer\r\n'
          b'Content-Type: multipart/alternative; boundary="inner"\r\n'
          b'\r\n'
          b'--inner\r\n'
          b'Content-Type: text/plain; charset=us-ascii\r\n'
          b'\r\n'
          b'plain words\r\n'
          b'--inner\r\n'
          b'Content-Type: text/html; charset=us-ascii\r\n'
          b'\r\n'
          b'<p>html words</p>\r\n'
          b'--inner--\r\n'
          b'--outer\r\n'
          b'Content-Type: application/octet-stream; name="x.bin"\r\n'
          b'Content-Transfer-Encoding: base64\r\n'
          b'\r\n'
          b'AAECAw==\r\n'
          b'--outer--\r\n')


def nested_message(subject):
    header, _, body = NESTED.partition(b'\r\n\r\n')
    return make_message(subject, body=body, extra=header + b'\r\n')


def fetch_one(imap, num, item):
    """One FETCH item's literal (or text) of one message."""
    typ, data = imap.fetch(num, '(%s)' % item)
    assert typ == 'OK', (typ, data)
    for part in data:
        if isinstance(part, tuple):
            return part[1]
    return data[0]


class ImapSuite(MailSuite):
    config = {'imap.sock.timeout': '30'}

    def imap(self, password=TRICKY, timeout=20):
        m = imaplib.IMAP4('127.0.0.1', self.suite.port('imap'), timeout=timeout)
        self.addCleanup(self._close, m)
        m.login('alice', password)
        return m

    @staticmethod
    def _close(m):
        try:
            m.shutdown()
        except OSError:
            pass

    def setUp(self):
        super().setUp()
        Suite._run([VELMOR_BIN, '--root', self.suite.root, '--passwd', 'alice', '--password', TRICKY])
        self.suite.ctl('reload users')

    def pop3(self):
        """POP3 for alice once IMAP has let go of her mailbox."""
        deadline = time.monotonic() + 10
        while True:
            try:
                return self.pop(password=TRICKY)
            except poplib.error_proto:
                if time.monotonic() > deadline:
                    raise
                time.sleep(0.05)

    def overview(self):
        try:
            with open(os.path.join(self.home, 'mail', 'overview', 'inbox'), 'rb') as f:
                return f.read()
        except FileNotFoundError:
            return b''

    def raw(self):
        s = socket.create_connection(('127.0.0.1', self.suite.port('imap')), timeout=10)
        self.addCleanup(s.close)
        f = s.makefile('rb')
        greeting = f.readline()
        self.assertIn(b'Velmor Server Suite IMAP4 Server (v2.0.49 [Linux/i386]) ready at', greeting)
        return s, f


class RoundTrip(ImapSuite):
    def test_what_smtp_took_imap_gives_back_as_pop3_does(self):
        subject = 'say "hi" to C:\\dir'
        plain = make_message(subject)
        self.send(plain, nested_message('nested'))
        m = self.imap()
        typ, data = m.select('INBOX')
        self.assertEqual((typ, data), ('OK', [b'2']))
        self.assertTrue(m.response('UIDVALIDITY')[1][0].isdigit())
        # Envelope subject quoted with its escapes, read back whole.
        env = fetch_one(m, '1', 'ENVELOPE')
        self.assertIn(b'"say \\"hi\\" to C:\\\\dir"', env)
        self.assertEqual(m.search(None, 'SUBJECT', '"\\"hi\\""'), ('OK', [b'1']))
        body = fetch_one(m, '1', 'BODY.PEEK[]')
        self.assertEqual(fetch_one(m, '1', 'BODY.PEEK[TEXT]'), split_message(plain)[1])
        self.assertEqual(int(re.search(rb'RFC822.SIZE (\d+)', fetch_one(m, '1', 'RFC822.SIZE')).group(1)), len(body))
        # The nested structure, and its parts reached by their numbers.
        structure = fetch_one(m, '2', 'BODYSTRUCTURE')
        self.assertRegex(structure.lower(), rb'\(\(\("text" "plain".*\)\("text" "html".*\) "alternative".*\)'
                                    rb'\("application" "octet-stream".*\) "mixed"')
        self.assertEqual(fetch_one(m, '2', 'BODY.PEEK[1.2]'), b'<p>html words</p>')
        self.assertEqual(fetch_one(m, '2', 'BODY.PEEK[2]'), b'AAECAw==')
        parsed = email.message_from_bytes(fetch_one(m, '2', 'BODY.PEEK[]'))
        self.assertEqual([p.get_content_type() for p in parsed.walk()],
                         ['multipart/mixed', 'multipart/alternative', 'text/plain', 'text/html',
                          'application/octet-stream'])
        m.logout()
        # POP3 gives the same bytes.
        p = self.pop3()
        _, lines, _ = p.retr(1)
        self.assertEqual(b'\r\n'.join(lines) + b'\r\n', body)
        p.quit()

    def test_flags_and_uidvalidity_survive_a_restart_and_a_kill(self):
        self.send(make_message('one'), make_message('two'), make_message('three'))
        m = self.imap()
        m.select('INBOX')
        validity = m.response('UIDVALIDITY')[1][0]
        m.store('1', '+FLAGS', '(\\Flagged \\Draft)')
        m.store('2', '+FLAGS', '(\\Answered \\Seen)')
        self.suite.stop()  # with the client still connected
        self.suite.start()
        m = self.imap()
        m.select('INBOX')
        self.assertEqual(m.response('UIDVALIDITY')[1][0], validity)
        self.assertEqual(m.fetch('1:2', '(FLAGS)')[1],
                         [b'1 (FLAGS (\\Flagged \\Draft))', b'2 (FLAGS (\\Seen \\Answered))'])
        # A change reaches the overview within a second, so a kill keeps it.
        m.store('3', '+FLAGS', '(\\Deleted)')
        self.assertTrue(wait_for(lambda: b'#flags 3 ' in self.overview(), timeout=5))
        self.suite.kill()
        os.unlink(self.suite.pid_file)  # what a kill leaves behind
        self.suite.start()
        self.send(make_message('four'))  # a delivery does not change the validity either
        m = self.imap()
        m.select('INBOX')
        self.assertEqual(m.response('UIDVALIDITY')[1][0], validity)
        self.assertEqual(m.fetch('3', '(FLAGS)')[1], [b'3 (FLAGS (\\Deleted))'])
        self.assertEqual(m.response('EXISTS')[1], [b'4'])


class SharedBox(ImapSuite):
    def test_two_connections_each_keep_their_numbers(self):
        self.send(make_message('one'), make_message('two'), make_message('three'))
        a, b = self.imap(), self.imap()
        a.select('INBOX')
        b.select('INBOX')
        a.store('2', '+FLAGS', '(\\Deleted)')
        a.expunge()
        # b still numbers message 3 as 3 during its FETCH; the EXPUNGE comes at NOOP.
        self.assertIn(b'Subject: three', fetch_one(b, '3', 'BODY.PEEK[HEADER]'))
        b.noop()
        self.assertEqual(b.response('EXPUNGE')[1], [b'2'])
        self.assertIn(b'Subject: three', fetch_one(b, '2', 'BODY.PEEK[HEADER]'))
        # New mail shows at the next command of a connected client.
        self.send(make_message('four'))
        b.noop()
        self.assertEqual(b.response('EXISTS')[1][-1], b'3')
        self.assertEqual(b.search(None, 'RECENT'), ('OK', [b'3']))
        a.logout()
        b.logout()


class Extensions(ImapSuite):
    def test_idle_hears_delivery_and_lets_pop3_in_afterwards(self):
        m = self.imap()
        m.select('INBOX')
        m.send(b'i IDLE\r\n')
        self.assertEqual(m.readline(), b'+ idling\r\n')
        self.send(make_message('while idle'))
        m.sock.settimeout(10)  # the update comes without a command
        self.assertEqual(m.readline(), b'* 1 EXISTS\r\n')
        m.send(b'DONE\r\n')
        while True:
            line = m.readline()
            self.assertTrue(line, 'connection closed')
            if line.startswith(b'i '):
                break
        self.assertEqual(line, b'i OK IDLE terminated\r\n')
        self.assertEqual(m.noop()[0], 'OK')
        m.logout()
        self.assertEqual(self.pop3().stat()[0], 1)

    def test_uid_expunge_takes_only_its_deleted_and_curl_moves(self):
        self.send(*(make_message(s) for s in ('one', 'two', 'three', 'four')))
        m = self.imap()
        m.select('INBOX')
        m.store('1,3', '+FLAGS', '(\\Deleted)')
        typ, _ = m.uid('EXPUNGE', '2:4')
        self.assertEqual(typ, 'OK')
        self.assertEqual(m.response('EXPUNGE')[1], [b'3'])
        self.assertEqual(m.search(None, 'ALL'), ('OK', [b'1 2 3']))
        self.assertEqual(m.search(None, 'DELETED'), ('OK', [b'1']))
        self.assertEqual(m.create('Trash')[0], 'OK')
        typ, data = m.append('Trash', None, None, make_message('kept'))
        self.assertRegex(data[0], rb'^\[APPENDUID \d+ 1\] ')
        if shutil.which('curl'):
            r = subprocess.run(['curl', '-sS', '--max-time', '20', '-u', 'alice:' + TRICKY,
                                'imap://127.0.0.1:%d/INBOX' % self.suite.port('imap'), '-X', 'UID MOVE 2 Trash'],
                               stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=30)
            self.assertEqual(r.returncode, 0, r.stderr)
        else:
            self.assertEqual(m.uid('MOVE', '2', 'Trash')[0], 'OK')
        m.noop()
        self.assertEqual(m.search(None, 'ALL'), ('OK', [b'1 2']))
        self.assertIn(b'Subject: four', fetch_one(m, '2', 'BODY.PEEK[HEADER]'))
        m.select('Trash')
        self.assertIn(b'Subject: two', fetch_one(m, '2', 'BODY.PEEK[HEADER]'))
        self.assertEqual(m.namespace(), ('OK', [b'(("" "/")) NIL NIL']))
        self.assertIn(b'(\\Trash) "/" "Trash"', b' '.join(m.list('""', '%')[1]))


def encoded_words(text):
    return '=?UTF-8?B?' + base64.b64encode(text.encode()).decode() + '?='


class Searching(ImapSuite):
    def search(self, m, key, text, charset='UTF-8'):
        """SEARCH CHARSET UTF-8 <key> with the text as a literal, as clients send non-ASCII words."""
        m.literal = text.encode()
        typ, data = m.search(charset, key)
        self.assertEqual(typ, 'OK')
        return data[0].split()

    def test_what_people_type_finds_decoded_headers_and_bodies(self):
        self.send(
            make_message(encoded_words('Встреча в пятницу'), body=b'see you\r\n'),
            make_message('report', body=base64.encodebytes('Большой ОТЧЁТ готов\r\n'.encode()).replace(b'\n', b'\r\n'),
                         extra=b'Content-Type: text/plain; charset=utf-8\r\nContent-Transfer-Encoding: base64\r\n'),
            make_message('latin', body=b'Gr=FC=DFe aus M=FCn=\r\nchen\r\n',
                         extra=b'Content-Type: text/plain; charset=iso-8859-1\r\n'
                               b'Content-Transfer-Encoding: quoted-printable\r\n'),
            make_message('koi8', body='Привет'.encode('koi8-r') + b'\r\n',
                         extra=b'Content-Type: text/plain; charset=koi8-r\r\nContent-Transfer-Encoding: 8bit\r\n'))
        m = self.imap()
        m.select('INBOX')
        for key, text, found in [
                ('SUBJECT', 'пятниц', [b'1']),
                ('SUBJECT', 'ПЯТНИЦУ', [b'1']),
                ('TEXT', 'встреча', [b'1']),
                ('BODY', 'отчёт', [b'2']),
                ('BODY', 'ОТЧЁТ ГОТОВ', [b'2']),
                ('BODY', 'münchen', [b'3']),
                ('BODY', 'ПРИВЕТ', [b'4']),
                ('TEXT', '0JLRgdGC', []),  # the encoded forms are not what is searched
                ('BODY', '0JHQvtC7', []),
                ('BODY', 'M=FCn', [])]:
            self.assertEqual(self.search(m, key, text), found, (key, text))
        self.assertEqual(m.search('US-ASCII', 'SUBJECT', 'report'), ('OK', [b'2']))
        self.assertEqual(m.search('KOI8-R', 'ALL'), ('NO', [b'[BADCHARSET (US-ASCII UTF-8)] unknown charset']))


class OtherClients(ImapSuite):
    def test_curl(self):
        if not shutil.which('curl'):
            self.skipTest('curl missing')
        msg = make_message('for curl')
        self.send(msg)
        url = 'imap://127.0.0.1:%d/INBOX;UID=1' % self.suite.port('imap')
        r = subprocess.run(['curl', '-sS', '--max-time', '20', '-u', 'alice:' + TRICKY, url],
                           stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=30)
        self.assertEqual(r.returncode, 0, r.stderr)
        self.assertEqual(split_message(r.stdout)[1], split_message(msg)[1])
        r = subprocess.run(['curl', '-sS', '--max-time', '20', '-u', 'alice:' + TRICKY,
                            'imap://127.0.0.1:%d/' % self.suite.port('imap')],
                           stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=30)
        self.assertEqual(r.returncode, 0, r.stderr)
        self.assertIn(b'"INBOX"', r.stdout)

    @staticmethod
    def maildir_files(root):
        """(path, name, content) of every message in the Maildir's INBOX."""
        for sub in ('cur', 'new'):
            d = os.path.join(root, 'INBOX', sub)
            for name in os.listdir(d) if os.path.isdir(d) else []:
                with open(os.path.join(d, name), 'rb') as f:
                    yield os.path.join(d, name), name, f.read()

    def maildir(self, root):
        return {name: data for _, name, data in self.maildir_files(root)}

    @staticmethod
    def mark(root, path, flags):
        """Gives a Maildir message the flags, as a mail program does."""
        base = os.path.basename(path).split(':2,')[0]
        os.rename(path, os.path.join(root, 'INBOX', 'cur', base + ':2,' + flags))

    def test_mbsync_both_ways_run_after_run(self):
        if not shutil.which('mbsync'):
            self.skipTest('mbsync missing')
        first, second = make_message('first'), nested_message('second')
        self.send(first, second)
        work = tempfile.mkdtemp(prefix='velmor-mbsync-')
        self.addCleanup(shutil.rmtree, work, True)
        local = os.path.join(work, 'mail')
        os.makedirs(local)
        config = os.path.join(work, 'mbsyncrc')
        with open(config, 'w') as f:
            f.write('IMAPAccount v\nHost 127.0.0.1\nPort %d\nUser alice\nPass "%s"\nSSLType None\n'
                    'AuthMechs LOGIN\nTimeout 20\n\n'
                    'IMAPStore remote\nAccount v\n\n'
                    'MaildirStore local\nPath %s/\nInbox %s/INBOX\n\n'
                    'Channel c\nFar :remote:\nNear :local:\nPatterns INBOX\nCreate Near\nSync All\n'
                    'Expunge Both\nSyncState *\n'
                    % (self.suite.port('imap'), TRICKY.replace('\\', '\\\\').replace('"', '\\"'), local, local))

        def sync():
            r = subprocess.run(['mbsync', '-c', config, '-V', 'c'], stdout=subprocess.PIPE,
                               stderr=subprocess.STDOUT, timeout=60)
            self.assertEqual(r.returncode, 0, r.stdout.decode(errors='replace') + self.suite.log('main')[-2000:])
            return r.stdout

        sync()
        got = self.maildir(os.path.join(local))
        self.assertEqual(len(got), 2)
        imap = self.imap()
        imap.select('INBOX', readonly=True)
        server = {fetch_one(imap, n, 'BODY.PEEK[]') for n in ('1', '2')}
        imap.logout()
        # byte-equal first sync (the Maildir keeps LF line ends and mbsync's own header)
        self.assertEqual({re.sub(rb'X-TUID: .*\n', b'', v) for v in got.values()},
                         {v.replace(b'\r\n', b'\n') for v in server})
        # Flags from the Maildir to the server: mark "first" seen and flagged.
        for path, _, data in list(self.maildir_files(local)):
            if b'Subject: first' in data:
                self.mark(local, path, 'FS')
        sync()
        imap = self.imap()
        imap.select('INBOX')
        self.assertEqual(imap.fetch('1', '(FLAGS)')[1], [b'1 (FLAGS (\\Seen \\Flagged))'])
        # Flags from the server to the Maildir, new mail, and a deletion.
        imap.store('2', '+FLAGS', '(\\Answered)')
        imap.logout()
        self.send(make_message('third'))
        sync()
        names = self.maildir(local)
        self.assertEqual(len(names), 3)
        [second_name] = [n for n, v in names.items() if b'Subject: second' in v]
        self.assertIn('R', second_name.split(':2,')[1])
        for path, _, data in list(self.maildir_files(local)):
            if b'Subject: third' in data:
                os.unlink(path)
        sync()
        imap = self.imap()
        imap.select('INBOX', readonly=True)
        self.assertEqual(imap.search(None, 'ALL'), ('OK', [b'1 2']))
        imap.logout()
        # After a restart nothing is fetched or sent again.
        self.suite.stop()
        self.suite.start()
        before = self.maildir(local)
        with open(self.inbox, 'rb') as f:
            stored = f.read()
        out = sync()
        self.assertEqual(self.maildir(local), before, out)
        with open(self.inbox, 'rb') as f:
            self.assertEqual(f.read(), stored)
        # New mail and a move on the server: the next run changes just those.
        imap = self.imap()
        imap.create('Archive')
        imap.select('INBOX')
        uid = imap.uid('SEARCH', 'SUBJECT', 'first')[1][0]
        self.assertEqual(imap.uid('MOVE', uid, 'Archive')[0], 'OK')
        imap.logout()
        self.send(make_message('fourth'))
        self.debatch(2)
        kept = {n for n, v in before.items() if b'Subject: second' in v}
        sync()
        after = self.maildir(local)
        self.assertEqual({n for n, v in after.items() if b'Subject: second' in v}, kept)
        self.assertEqual(sorted(re.search(rb'Subject: (\w+)', v).group(1) for v in after.values()),
                         [b'fourth', b'second'])

    def test_offlineimap(self):
        exe = shutil.which('offlineimap') or shutil.which('offlineimap3')
        if not exe:
            self.skipTest('offlineimap missing')
        self.send(make_message('off one'), nested_message('off two'))
        work = tempfile.mkdtemp(prefix='velmor-offlineimap-')
        self.addCleanup(shutil.rmtree, work, True)
        config = os.path.join(work, 'rc')
        local = os.path.join(work, 'mail')
        with open(config, 'w') as f:
            f.write('[general]\naccounts = v\nmetadata = %s/meta\nui = quiet\n\n'
                    '[Account v]\nlocalrepository = l\nremoterepository = r\n\n'
                    '[Repository l]\ntype = Maildir\nlocalfolders = %s\n\n'
                    '[Repository r]\ntype = IMAP\nremotehost = 127.0.0.1\nremoteport = %d\nssl = no\n'
                    'starttls = no\nremoteuser = alice\nremotepass = %s\nfolderfilter = lambda f: f == "INBOX"\n'
                    % (work, local, self.suite.port('imap'), TRICKY.replace('%', '%%')))

        def run():
            r = subprocess.run([exe, '-c', config, '-o', '-u', 'quiet'], stdout=subprocess.PIPE,
                               stderr=subprocess.STDOUT, timeout=90)
            self.assertEqual(r.returncode, 0, r.stdout.decode(errors='replace'))

        run()
        got = self.maildir(local)
        self.assertEqual(len(got), 2)
        imap = self.imap()
        imap.select('INBOX', readonly=True)
        def lines(text):  # offlineimap writes LF line ends and may add empty lines
            return [line.rstrip(b'\r') for line in text.split(b'\n') if line.rstrip(b'\r')]
        self.assertEqual(sorted(lines(v) for v in got.values()),
                         sorted(lines(fetch_one(imap, n, 'BODY.PEEK[]')) for n in ('1', '2')))
        imap.logout()
        for path, _, _ in list(self.maildir_files(local)):
            self.mark(local, path, 'S')
        self.send(make_message('off three'))
        run()
        self.assertEqual(len(self.maildir(local)), 3)
        imap = self.imap()
        imap.select('INBOX', readonly=True)
        self.assertEqual(imap.search(None, 'SEEN'), ('OK', [b'1 2']))
        imap.logout()
        before = self.maildir(local)
        run()
        self.assertEqual(self.maildir(local), before)

    def test_neomutt_reads_and_saves(self):
        if not shutil.which('neomutt') or not shutil.which('tmux'):
            self.skipTest('neomutt or tmux missing')
        self.send(make_message('for neomutt'))
        work = tempfile.mkdtemp(prefix='velmor-neomutt-')
        self.addCleanup(shutil.rmtree, work, True)
        rc = os.path.join(work, 'rc')
        with open(rc, 'w') as f:
            f.write("set folder='imap://alice@127.0.0.1:%d/'\nset spoolfile='+INBOX'\n"
                    "set imap_pass='%s'\nset imap_authenticators='login'\nset ssl_starttls=no\n"
                    "set ssl_force_tls=no\nset confirmcreate=no\nset confirmappend=no\nset wait_key=no\n"
                    "set imap_check_subscribed=no\nset mail_check=1\nset record=''\nset move=no\n"
                    % (self.suite.port('imap'), TRICKY))
        session = 'velmor-neomutt-%d' % os.getpid()
        env = dict(os.environ, HOME=work, TERM='xterm')
        subprocess.run(['tmux', 'new-session', '-d', '-s', session, '-x', '160', '-y', '40',
                        'neomutt -n -F ' + rc], env=env, check=True)
        self.addCleanup(subprocess.run, ['tmux', 'kill-session', '-t', session], stderr=subprocess.DEVNULL)

        def screen():
            return subprocess.run(['tmux', 'capture-pane', '-p', '-t', session], stdout=subprocess.PIPE,
                                  text=True).stdout

        def keys(*k):
            subprocess.run(['tmux', 'send-keys', '-t', session] + list(k), check=True)

        self.assertTrue(wait_for(lambda: 'for neomutt' in screen(), timeout=20), screen())
        keys('Enter')
        self.assertTrue(wait_for(lambda: 'From here on the body goes on' in screen(), timeout=20))
        keys('s')
        self.assertTrue(wait_for(lambda: 'Save to mailbox' in screen(), timeout=20))
        keys('C-u', '=mail/saved', 'Enter')
        saved = os.path.join(self.home, 'mail', 'saved')

        def stored():
            try:
                with open(saved, 'rb') as f:
                    return b'Subject: for neomutt' in f.read()
            except FileNotFoundError:
                return False
        self.assertTrue(wait_for(stored, timeout=20))
        keys('q')
        keys('q')
        m = self.imap()
        self.assertEqual(m.select('mail/saved'), ('OK', [b'1']))
        self.assertEqual(m.fetch('1', '(FLAGS)')[1], [b'1 (FLAGS (\\Seen \\Recent))'])


class BadInput(ImapSuite):
    config = {'imap.sock.timeout': '30'}

    def test_commands_before_login_and_name_tricks(self):
        s, f = self.raw()
        s.sendall(b'a SELECT INBOX\r\nb DELETE etc/passwd\r\nc CAPABILITY\r\n')
        self.assertEqual([f.readline() for _ in range(4)],
                         [b'a BAD Not in correct auth state\r\n', b'b BAD Not in correct auth state\r\n',
                          b'* CAPABILITY IMAP4rev1 IDLE UIDPLUS MOVE NAMESPACE SPECIAL-USE STARTTLS\r\n', b'c OK CAPABILITY completed\r\n'])
        m = self.imap()
        before = os.listdir(os.path.dirname(self.home))
        before_home = sorted(os.listdir(self.home))
        for name in ('../alice', '/etc/passwd', '~root', '.forward', 'mail/overview/inbox', 'mail/inbox~'):
            typ, data = m._simple_command('CREATE', '"%s"' % name)
            self.assertEqual(typ, 'NO', name)
        self.assertEqual(os.listdir(os.path.dirname(self.home)), before)
        self.assertEqual(sorted(os.listdir(self.home)), before_home)

    def test_append_sizes_slow_literals_and_a_client_gone_midway(self):
        self.send(make_message('there first'))
        s, f = self.raw()
        s.sendall(b'l LOGIN alice {10}\r\n')
        self.assertEqual(f.readline(), b'+ Ready for literal data\r\n')
        s.sendall(TRICKY.encode() + b'\r\n')
        self.assertEqual(f.readline(), b'l OK LOGIN completed\r\n')
        for size, reply in ((b'0', b'a BAD Invalid size argument\r\n'), (b'-1', b'a BAD Invalid size argument\r\n'),
                            (b'99999999999', b'a NO [TOOBIG]')):
            s.sendall(b'a APPEND INBOX {' + size + b'}\r\n')
            self.assertTrue(f.readline().startswith(reply))
        # A message a byte per packet.
        msg = make_message('slowly')
        s.sendall(b'b APPEND INBOX (\\Seen) {%d}\r\n' % len(msg))
        self.assertEqual(f.readline(), b'+ Ready for message body\r\n')
        s.setsockopt(socket.IPPROTO_TCP, socket.TCP_NODELAY, 1)
        for i in range(len(msg)):
            s.send(msg[i:i + 1])
            if i == 40:
                self.send(make_message('meanwhile'))  # a delivery in the middle of the literal
                self.debatch(2)
        s.sendall(b'\r\n')
        self.assertRegex(f.readline(), rb'^b OK \[APPENDUID \d+ 3\] APPEND completed\r\n$')
        before = open(self.inbox, 'rb').read()
        # A client gone in the middle of its literal leaves nothing behind.
        s2, f2 = self.raw()
        s2.sendall(b'l LOGIN alice "pa\\"ss\\\\word"\r\nx APPEND INBOX {5000}\r\n')
        self.assertEqual(f2.readline(), b'l OK LOGIN completed\r\n')
        self.assertEqual(f2.readline(), b'+ Ready for message body\r\n')
        s2.sendall(b'Subject: half\r\n\r\n' + b'x' * 1000)
        f2.close()
        s2.close()
        m = self.imap()
        m.select('INBOX')
        self.assertEqual(m.search(None, 'ALL'), ('OK', [b'1 2 3']))
        self.assertIn(b'Subject: meanwhile', fetch_one(m, '2', 'BODY.PEEK[HEADER]'))
        self.assertEqual(fetch_one(m, '3', 'BODY.PEEK[TEXT]'), split_message(msg)[1])
        self.assertEqual(m.fetch('3', '(UID FLAGS)')[1], [b'3 (UID 3 FLAGS (\\Seen \\Recent))'])
        self.assertEqual(open(self.inbox, 'rb').read(), before)

    def test_huge_ranges_on_a_big_mailbox(self):
        parts = []
        for uid in range(1, 5001):
            parts.append(b'From bob@elsewhere.test Tue Nov 14 22:13:20 2023\r\nFrom: bob@elsewhere.test\r\n'
                         b'Subject: number %d\r\nX-UID: %d\r\n\r\nbody %d\r\n.\r\n' % (uid, uid, uid))
        os.makedirs(os.path.dirname(self.inbox), exist_ok=True)
        with open(self.inbox, 'wb') as f:
            f.write(b''.join(parts))
        m = self.imap(timeout=30)  # a time-out, not a timing assertion
        self.assertEqual(m.select('INBOX'), ('OK', [b'5000']))
        with self.assertRaises(imaplib.IMAP4.error):
            m.fetch('1:4294967295', '(FLAGS)')
        typ, data = m.uid('FETCH', '4990:1000000000', '(UID)')
        self.assertEqual((typ, len(data)), ('OK', 11))
        typ, data = m.uid('SEARCH', 'UID', '1:4294967295')
        self.assertEqual(len(data[0].split()), 5000)
        self.assertEqual(m.store('5:*', '+FLAGS.SILENT', '(\\Deleted)')[0], 'OK')
        self.assertEqual(m.search(None, 'UNDELETED'), ('OK', [b'1 2 3 4']))
        self.assertEqual(m.uid('SEARCH', 'SINCE', '14-Nov-2023', 'UNDELETED'), ('OK', [b'1 2 3 4']))
        # Reading every body takes more than one slice of the loop.
        self.assertEqual(m.search(None, 'OR', 'BODY', '"body 4999"', 'SUBJECT', '"number 4998"'),
                         ('OK', [b'4998 4999']))

if __name__ == '__main__':
    unittest.main()

"""Debatching the incoming queue: outgoing files, aliases and lists, group
limits, error mails and the oddments folder, driven through velmorctl."""
import os
import smtplib
import time
import unittest

from harness import Suite

BASE = {'mail.debatch.time': '0', 'mail.domains': 'localhost, site.example',
        'admin.email': 'postmaster@site.example'}


def numbered(suite, folder):
    d = suite.path(folder)
    if not os.path.isdir(d):
        return []
    return sorted((os.path.join(d, n) for n in os.listdir(d) if n.isdigit()),
                  key=lambda p: int(os.path.basename(p)))


def read(path):
    with open(path, 'rb') as f:
        return f.read()


class QueueCase(unittest.TestCase):
    config = {}
    files = {}  # path under the root -> contents, written before start

    def setUp(self):
        self.suite = Suite(config=dict(BASE, **self.config))
        for rel, text in self.files.items():
            path = self.suite.path(rel)
            os.makedirs(os.path.dirname(path), exist_ok=True)
            with open(path, 'w') as f:
                f.write(text)
        self.addCleanup(self.suite.cleanup)
        self.suite.start()

    def send(self, sender, recipients, message):
        with smtplib.SMTP('127.0.0.1', self.suite.port('smtp'), timeout=10) as c:
            c.sendmail(sender, recipients, message)

    def queue(self, files):
        """Puts files into the incoming queue as another program would."""
        for name, text in files.items():
            with open(os.path.join(self.suite.path('mail/in'), name), 'w', newline='') as f:
                f.write(text)
        self.suite.ctl('mailrescan')

    def debatch_all(self):
        """Debatches until the incoming queue is empty (error mails included)."""
        deadline = time.time() + 15
        while time.time() < deadline:
            if not numbered(self.suite, 'mail/in'):
                return
            self.suite.ctl('maildebatch')
            time.sleep(0.2)
        self.fail('the incoming queue did not drain')

    def outgoing(self):
        return [read(p) for p in numbered(self.suite, 'mail/out')]


class DebatchTest(QueueCase):
    config = {'smtp.direct': 'direct.example'}
    files = {
        'config/aliases': '# aliases\nteam bob@remote.example,$lists/team\nvoid nobody\n',
        'lists/team': 'carl@remote.example\n\n%dave@localhost\n',
    }

    def test_remote_recipients_share_one_outgoing_file_and_are_listed(self):
        self.send('ann@far.example', ['bob@remote.example', 'carl@remote.example', 'x@direct.example'],
                  'Subject: out\r\n\r\nbody\r\n..dot\r\n')
        self.debatch_all()
        files = sorted(self.outgoing(), key=len)
        self.assertEqual(len(files), 2)
        direct, shared = (files if b'direct.example' in files[0] else files[::-1])
        self.assertTrue(shared.startswith(b'MAIL FROM:<ann@far.example>\r\nRCPT TO:<bob@remote.example>\r\n'
                                          b'RCPT TO:<carl@remote.example>\r\nDATA\r\nReceived: from 127.0.0.1\r\n'))
        self.assertTrue(shared.endswith(b'\r\n\r\nbody\r\n...dot\r\n.\r\n'))
        self.assertTrue(direct.startswith(b'MAIL FROM:<ann@far.example>\r\nRCPT TO:<x@direct.example>\r\nDATA\r\n'))
        rc, listing = self.suite.ctl('listmq')
        self.assertEqual(rc, 0)
        self.assertIn('start mq', listing)
        self.assertIn('ann@far.example', listing)
        self.assertIn('bob@remote.example, carl@remote.example', listing)
        self.assertIn('end mq', listing)
        self.assertEqual(numbered(self.suite, 'mail/in'), [])

    def test_alias_and_list_expand(self):
        self.send('ann@far.example', ['team@localhost', 'void@site.example'], 'Subject: team\r\n\r\nhello\r\n')
        self.debatch_all()
        [out] = self.outgoing()
        envelope = out.split(b'DATA\r\n')[0]
        self.assertEqual(envelope, b'MAIL FROM:<ann@far.example>\r\nRCPT TO:<bob@remote.example>\r\n'
                                   b'RCPT TO:<carl@remote.example>\r\nRCPT TO:<dave@localhost>\r\n')

    def test_error_mail_goes_from_the_null_sender_and_never_to_it(self):
        # The SMTP server refuses unknown local users; these files come from
        # elsewhere (a fetched or a locally written message).
        self.queue({'1': 'MAIL FROM:<>\r\nRCPT TO:<nosuchuser@localhost>\r\nDATA\r\nSubject: bounce me\r\n\r\nx\r\n.\r\n'})
        self.debatch_all()
        self.assertEqual(self.outgoing(), [])
        self.queue({'2': 'MAIL FROM:<ann@far.example>\r\nRCPT TO:<nosuchuser@localhost>\r\nDATA\r\n'
                         'Subject: bounce me\r\n\r\nx\r\n.\r\n'})
        self.debatch_all()
        [out] = self.outgoing()
        self.assertTrue(out.startswith(b'MAIL FROM:<>\r\nRCPT TO:<ann@far.example>\r\nDATA\r\n'))
        self.assertIn(b'\r\nFrom: postmaster@site.example\r\n', out)
        self.assertIn(b'\r\nSubject: Mail failure\r\n', out)
        self.assertIn(b'\r\nX-Loop: 0\r\n', out)
        self.assertIn(b'Local user nosuchuser does not exist\r\n', out)
        self.assertIn(b'Subject: bounce me\r\n', out)
        self.assertTrue(out.endswith(b'\r\n.\r\n'))
        self.assertNotIn(b'\n', out.replace(b'\r\n', b''))

    def test_malformed_and_looping_files_go_to_oddments(self):
        received = ''.join('Received: from hop%d\r\n' % i for i in range(31))
        samples = {
            '1': 'MAIL FROM:<a@b>\r\n',  # too short
            '2': 'MAIL FROM:<a@far.example>\r\nDATA\r\nSubject: none\r\n\r\nx\r\n.\r\n',
            '3': ('MAIL FROM:<a@far.example>\r\nRCPT TO:<bob@remote.example>\r\nDATA\r\n' + received +
                  'Subject: loop\r\n\r\nx\r\n.\r\n'),
            '4': ('MAIL FROM:<a@far.example>\r\nRCPT TO:<nosuchuser@localhost>\r\nDATA\r\n'
                  'Subject: loop\r\nx-loop: 1\r\n\r\nx\r\n.\r\n'),
        }
        self.queue(samples)
        self.debatch_all()
        odd = [read(p) for p in numbered(self.suite, 'mail/odd')]
        self.assertEqual(sorted(odd), sorted(t.encode() for t in samples.values()))
        self.assertEqual(self.outgoing(), [])
        errors = ''.join(self.suite.log(n) for n in os.listdir(self.suite.path('logs')))
        for reason in ('Article was too short', 'No recipients', 'Too many Received headers',
                       'Loop condition caught'):
            self.assertIn(reason, errors)


class LocalDeliveryTest(QueueCase):
    files = {
        'config/aliases': 'team demo,bob@remote.example\nlist $lists/local\n',
        'lists/local': 'demo@localhost\nzed@remote.example\n',
    }

    def test_local_users_aliases_and_lists_reach_the_mailbox(self):
        self.send('ann@far.example', ['demo@localhost'], 'Subject: direct\r\n\r\none\r\n')
        self.send('ann@far.example', ['team@site.example', 'list@localhost'], 'Subject: expanded\r\n\r\ntwo\r\n')
        self.send('ann@far.example', ['demo_work@site.example'], 'Subject: sub\r\n\r\nthree\r\n')
        self.debatch_all()
        inbox = read(self.suite.path('home/demo/mail/inbox'))
        # The alias and the list both name demo: one copy is enough.
        self.assertEqual(inbox.count(b'\r\nX-RCPT-TO: demo\r\n'), 2)
        self.assertEqual(inbox.count(b'Subject: expanded\r\n'), 1)
        self.assertIn(b'Subject: direct\r\n', inbox)
        self.assertIn(b'Subject: sub\r\n', read(self.suite.path('home/demo/mail/work')))
        [out] = self.outgoing()
        self.assertEqual(out.split(b'DATA\r\n')[0], b'MAIL FROM:<ann@far.example>\r\nRCPT TO:<bob@remote.example>\r\n'
                                                   b'RCPT TO:<zed@remote.example>\r\n')
        self.assertEqual(numbered(self.suite, 'mail/in'), [])
        self.assertEqual(numbered(self.suite, 'mail/odd'), [])


class GroupLimitTest(QueueCase):
    files = {'config/groups': '#0\n%group.name: everyone\n%mail.msg.size: 1\n%mail.smtp.send: yes\n'}

    def test_message_over_the_size_limit_is_refused_with_an_error_mail(self):
        # Over SMTP it never gets this far; a file written by another program does.
        self.queue({'1': 'MAIL FROM:<ann@far.example>\r\nRCPT TO:<bob@remote.example>\r\nDATA\r\n'
                         'Subject: large\r\n\r\n' + 'z' * 3000 + '\r\n.\r\n'})
        self.debatch_all()
        [out] = self.outgoing()
        self.assertTrue(out.startswith(b'MAIL FROM:<>\r\nRCPT TO:<ann@far.example>\r\n'))
        self.assertIn(b'The following email was greater than the 1kB length limit, at 3kB\r\n', out)
        self.assertIn(b'Subject: large\r\n', out)
        self.assertNotIn(b'zzzz', out)  # the refused body is not sent back
        self.assertFalse(any(b'bob@remote.example' in o for o in self.outgoing()))


if __name__ == '__main__':
    unittest.main()

"""Users' homes belong to the users: links and odd files they plant there
never make the daemon (running as root) read, write or hand out a file
outside the home. The links are planted by an unprivileged user."""

import os
import poplib
import smtplib
import stat
import subprocess
import time
import unittest

from harness import Suite, VELMOR_BIN

DOMAIN = 'example.test'
PASSWORD = 'sesame-42'
UID = 4242
USERS = ('mallory', 'trudy', 'oscar', 'peggy', 'victor')


@unittest.skipUnless(os.geteuid() == 0, 'plants links as another user, which needs root')
class PlantedLinks(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.suite = Suite(config={'mail.domains': DOMAIN, 'pop.sock.timeout': '30'})
        cls.addClassCleanup(cls.suite.cleanup)
        os.makedirs(cls.suite.path('home'), exist_ok=True)
        for folder in (cls.suite.root, cls.suite.path('home')):
            os.chmod(folder, 0o755)  # the users must reach their homes
        for user in USERS:
            home = cls.suite.path('home/' + user)
            Suite._run([VELMOR_BIN, '--root', cls.suite.root, '--adduser', user, '--password', PASSWORD,
                        '--home', home])
            os.chown(home, UID, UID)
        cls.suite.start()

    @classmethod
    def tearDownClass(cls):
        cls.suite.stop()

    # ---- helpers -------------------------------------------------------------
    def home(self, user, rel=''):
        return os.path.join(self.suite.path('home/' + user), rel)

    def as_user(self, *command):
        subprocess.run(['setpriv', '--reuid', str(UID), '--regid', str(UID), '--clear-groups'] + list(command),
                       check=True, timeout=10)

    def root_file(self, name, text, mode=0o600):
        path = self.suite.path(name)
        with open(path, 'wb') as f:
            f.write(text)
        os.chmod(path, mode)
        return path

    def deliver(self, to, subject):
        """Sends a message to `to` and debatches until the queue is empty."""
        with smtplib.SMTP('127.0.0.1', self.suite.port('smtp'), timeout=10) as smtp:
            smtp.sendmail('bob@elsewhere.test', [to + '@' + DOMAIN],
                          'From: bob@elsewhere.test\r\nSubject: %s\r\n\r\nhello\r\n' % subject)
        self.drain()

    def queued(self):
        return [n for n in os.listdir(self.suite.path('mail/in')) if n.isdigit()]

    def drain(self, or_log=None):
        """Debatches until the queue is empty, or the errors log holds `or_log`."""
        deadline = time.monotonic() + 15
        while time.monotonic() < deadline:
            self.suite.ctl('maildebatch')
            if not self.queued() or (or_log and or_log in self.suite.log('errors')):
                return
            time.sleep(0.05)
        self.fail('the queue did not drain: %s' % self.suite.log('errors')[-2000:])

    def drain_after_unlink(self):
        self.as_user('rm', self.home('peggy', 'mail/overview'))
        self.suite.ctl('mailrescan')  # the waiting message is tried again
        self.drain()

    def assertRefused(self, path_below_homes, what='is a symbolic link'):
        self.assertIn('%s %s' % (self.suite.path('home/' + path_below_homes), what), self.suite.log('errors'))

    def assertUntouched(self, path, text, mode=0o600):
        st = os.lstat(path)
        self.assertEqual((st.st_uid, stat.S_IMODE(st.st_mode)), (0, mode))
        with open(path, 'rb') as f:
            self.assertEqual(f.read(), text)

    def pop(self, user):
        p = poplib.POP3('127.0.0.1', self.suite.port('pop'), timeout=10)
        self.addCleanup(p.close)
        p.user(user)
        p.pass_(PASSWORD)
        return p

    # ---- the cases -------------------------------------------------------------
    def test_a_linked_mail_folder_is_not_followed_by_a_sub_address(self):
        outside = self.suite.path('outside-mail')
        os.mkdir(outside)
        passwd = self.root_file('outside-mail/passwd', b'root:x:0:0::/root:/bin/sh\n', 0o644)
        self.as_user('ln', '-s', outside, self.home('mallory', 'mail'))
        self.deliver('mallory_passwd', 'into passwd')
        self.assertUntouched(passwd, b'root:x:0:0::/root:/bin/sh\n', 0o644)
        self.assertEqual(os.listdir(outside), ['passwd'])
        self.assertRefused('mallory/mail')

    def test_a_linked_inbox_is_never_read_back(self):
        secret = self.root_file('secret', b'From x Tue Nov 14 22:13:20 2023\r\nSubject: the secret\r\n\r\ns3cr3t\r\n.\r\n')
        self.as_user('mkdir', self.home('trudy', 'mail'))
        self.as_user('ln', '-s', secret, self.home('trudy', 'mail/inbox'))
        p = self.pop('trudy')
        self.assertEqual(p.stat()[0], 0)
        with self.assertRaises(poplib.error_proto):
            p.retr(1)
        self.assertRefused('trudy/mail/inbox')
        self.deliver('trudy', 'not into the secret')
        self.assertUntouched(secret, b'From x Tue Nov 14 22:13:20 2023\r\nSubject: the secret\r\n\r\ns3cr3t\r\n.\r\n')

    def test_a_linked_expunge_file_leaves_its_target_alone(self):
        target = self.root_file('target', b'keep me\n')
        self.as_user('mkdir', self.home('oscar', 'mail'))
        self.deliver('oscar', 'first')
        self.deliver('oscar', 'second')
        self.as_user('ln', '-s', target, self.home('oscar', 'mail/inbox~'))
        p = self.pop('oscar')
        self.assertEqual(p.stat()[0], 2)
        p.dele(1)
        p.quit()
        self.assertUntouched(target, b'keep me\n')
        with open(self.home('oscar', 'mail/inbox'), 'rb') as f:
            box = f.read()
        self.assertNotIn(b'Subject: first', box)
        self.assertIn(b'Subject: second', box)

    def test_a_linked_overview_folder_keeps_the_message_waiting(self):
        outside = self.suite.path('outside-overview')
        os.mkdir(outside)
        self.as_user('mkdir', self.home('peggy', 'mail'))
        self.as_user('ln', '-s', outside, self.home('peggy', 'mail/overview'))
        self.addCleanup(lambda: os.path.islink(self.home('peggy', 'mail/overview')) and self.drain_after_unlink())
        with smtplib.SMTP('127.0.0.1', self.suite.port('smtp'), timeout=10) as smtp:
            smtp.sendmail('bob@elsewhere.test', ['peggy@' + DOMAIN], 'Subject: waits\r\n\r\nhello\r\n')
        self.drain(or_log="Mail delivery for `peggy' waits")
        self.assertEqual(os.listdir(outside), [])
        self.assertRefused('peggy/mail/overview')
        self.assertEqual(len(self.queued()), 1)
        # Once the link is gone, the message goes in, once.
        self.drain_after_unlink()
        p = self.pop('peggy')
        self.assertEqual(p.stat()[0], 1)
        self.assertIn(b'Subject: waits', b'\r\n'.join(p.retr(1)[1]))

    def test_linked_forward_and_vacation_files_are_not_read(self):
        secret = self.root_file('forward-secret', b'victim@secret.example\n')
        self.as_user('ln', '-s', secret, self.home('victor', '.forward'))
        self.as_user('ln', '-s', secret, self.home('victor', '.vacation'))
        self.deliver('victor', 'stays here')
        self.assertEqual(self.pop('victor').stat()[0], 1)
        self.assertRefused('victor/.forward')
        self.assertRefused('victor/.vacation')
        for folder in ('mail/in', 'mail/out', 'mail/odd'):
            for dirpath, _, names in os.walk(self.suite.path(folder)):
                for name in names:
                    with open(os.path.join(dirpath, name), 'rb') as f:
                        self.assertNotIn(b'secret.example', f.read())


if __name__ == '__main__':
    unittest.main()

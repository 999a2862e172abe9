"""Links an unprivileged user plants in their home never make the daemon
(running as root) read, write or hand out a file outside the home."""

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
SECRET = b'From x Tue Nov 14 22:13:20 2023\r\nSubject: secret\r\n\r\nvictim@secret.example\r\n.\r\n'


@unittest.skipUnless(os.geteuid() == 0, 'plants links as another user, which needs root')
class PlantedLinks(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.suite = s = Suite(config={'mail.domains': DOMAIN})
        cls.addClassCleanup(s.cleanup)
        os.makedirs(s.path('home'), exist_ok=True)
        for folder in (s.root, s.path('home')):
            os.chmod(folder, 0o755)  # the users must reach their homes
        for user in ('mallory', 'trudy', 'oscar', 'peggy', 'victor'):
            Suite._run([VELMOR_BIN, '--root', s.root, '--adduser', user, '--password', PASSWORD,
                        '--home', s.path('home/' + user)])
            os.chown(s.path('home/' + user), UID, UID)
        s.start()
        cls.secret = s.path('secret')
        with open(cls.secret, 'wb') as f:
            f.write(SECRET)
        os.chmod(cls.secret, 0o600)

    @classmethod
    def tearDownClass(cls):
        cls.suite.stop()

    def home(self, path):
        return self.suite.path('home/' + path)

    def as_user(self, *command):
        subprocess.run(['setpriv', '--reuid', str(UID), '--regid', str(UID), '--clear-groups'] + list(command),
                       check=True, timeout=10)

    def deliver(self, to, subject, or_log=None):
        """Sends a message and debatches until the queue is empty (or the errors log holds `or_log`)."""
        with smtplib.SMTP('127.0.0.1', self.suite.port('smtp'), timeout=10) as smtp:
            smtp.sendmail('bob@elsewhere.test', [to + '@' + DOMAIN], 'Subject: %s\r\n\r\nhello\r\n' % subject)
        deadline = time.monotonic() + 15
        while time.monotonic() < deadline:
            self.suite.ctl('maildebatch')
            if not self.queued() or (or_log and or_log in self.suite.log('errors')):
                return
            time.sleep(0.05)
        self.fail('the queue did not drain: %s' % self.suite.log('errors')[-2000:])

    def queued(self):
        return [n for n in os.listdir(self.suite.path('mail/in')) if n.isdigit()]

    def assertRefused(self, path):
        self.assertIn(self.home(path) + ' is a symbolic link', self.suite.log('errors'))

    def assertSecretUntouched(self):
        st = os.stat(self.secret)
        self.assertEqual((st.st_uid, stat.S_IMODE(st.st_mode)), (0, 0o600))
        with open(self.secret, 'rb') as f:
            self.assertEqual(f.read(), SECRET)

    def pop(self, user):
        p = poplib.POP3('127.0.0.1', self.suite.port('pop'), timeout=10)
        self.addCleanup(p.close)
        p.user(user)
        p.pass_(PASSWORD)
        return p

    def test_a_linked_mail_folder_is_not_followed_by_a_sub_address(self):
        self.as_user('ln', '-s', self.suite.root, self.home('mallory/mail'))
        self.deliver('mallory_secret', 'into the secret')
        self.assertSecretUntouched()
        self.assertRefused('mallory/mail')

    def test_a_linked_inbox_is_never_read_back_or_written(self):
        self.as_user('mkdir', self.home('trudy/mail'))
        self.as_user('ln', '-s', self.secret, self.home('trudy/mail/inbox'))
        p = self.pop('trudy')
        self.assertEqual(p.stat()[0], 0)
        self.assertRaises(poplib.error_proto, p.retr, 1)
        self.deliver('trudy', 'not into the secret')
        self.assertSecretUntouched()
        self.assertRefused('trudy/mail/inbox')

    def test_a_linked_expunge_file_leaves_its_target_alone(self):
        self.as_user('mkdir', self.home('oscar/mail'))
        self.deliver('oscar', 'first')
        self.deliver('oscar', 'second')
        self.as_user('ln', '-s', self.secret, self.home('oscar/mail/inbox~'))
        p = self.pop('oscar')
        p.dele(1)
        p.quit()
        self.assertSecretUntouched()
        with open(self.home('oscar/mail/inbox'), 'rb') as f:
            box = f.read()
        self.assertEqual((b'Subject: first' in box, b'Subject: second' in box), (False, True))

    def test_a_linked_overview_folder_keeps_the_message_waiting(self):
        outside = self.suite.path('outside')
        os.mkdir(outside)
        self.as_user('mkdir', self.home('peggy/mail'))
        self.as_user('ln', '-s', outside, self.home('peggy/mail/overview'))
        self.addCleanup(self.suite.ctl, 'mailrescan')
        self.addCleanup(self.as_user, 'rm', '-f', self.home('peggy/mail/overview'))
        self.deliver('peggy', 'waits', or_log="Mail delivery for `peggy' waits")
        self.assertEqual((os.listdir(outside), len(self.queued())), ([], 1))
        self.assertRefused('peggy/mail/overview')

    def test_linked_forward_and_vacation_files_are_not_read(self):
        self.as_user('ln', '-s', self.secret, self.home('victor/.forward'))
        self.as_user('ln', '-s', self.secret, self.home('victor/.vacation'))
        self.deliver('victor', 'stays here')
        self.assertEqual(self.pop('victor').stat()[0], 1)
        self.assertRefused('victor/.forward')
        self.assertRefused('victor/.vacation')
        for folder in ('mail/in', 'mail/out', 'mail/odd'):
            for path, _, names in os.walk(self.suite.path(folder)):
                for name in names:
                    with open(os.path.join(path, name), 'rb') as f:
                        self.assertNotIn(b'secret.example', f.read())


if __name__ == '__main__':
    unittest.main()

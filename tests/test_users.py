"""Users end to end: the administrator's command line, the demo user of a new
installation, and password changes and reloads through the control channel."""

import os
import poplib
import re
import shutil
import stat
import subprocess
import tempfile
import unittest

from harness import VELMOR_BIN, Suite, SuiteTestCase


def velmor(root, *args, stdin=None):
    """Runs the velmor binary on an installation; (returncode, stdout + stderr)."""
    done = subprocess.run([VELMOR_BIN, '--root', root, *args], input=stdin, capture_output=True,
                          text=True, timeout=30)
    return done.returncode, done.stdout + done.stderr


def read(path, mode='r'):
    with open(path, mode) as f:
        return f.read()


def crypt_hash(password, salt):
    """The "$1$" hash that `openssl passwd -1` makes."""
    done = subprocess.run(['openssl', 'passwd', '-1', '-salt', salt, password],
                          capture_output=True, text=True, timeout=30, check=True)
    return done.stdout.strip()


class InitMakesADemoUser(unittest.TestCase):
    def setUp(self):
        self.root = tempfile.mkdtemp(prefix='velmor-users-')
        self.addCleanup(shutil.rmtree, self.root, ignore_errors=True)

    def test_random_password_that_verifies_and_is_made_once(self):
        rc, out = velmor(self.root, '--init')
        self.assertEqual(rc, 0, out)
        found = re.search(r'Demo login: demo  password: (\S+)', out)
        self.assertIsNotNone(found, out)
        password = found.group(1)
        self.assertGreaterEqual(len(password), 12)

        users = os.path.join(self.root, 'config', 'users')
        self.assertEqual(stat.S_IMODE(os.stat(users).st_mode), 0o600)
        lines = [l for l in read(users).splitlines() if l.startswith('demo,')]
        self.assertEqual(len(lines), 1)
        login, hashed, _full, home, group = lines[0].split(',')
        salt = hashed.split('$')[2]
        self.assertEqual(crypt_hash(password, salt), hashed)
        self.assertEqual(home, os.path.join(os.path.realpath(self.root), 'home', 'demo'))
        self.assertTrue(os.path.isdir(home))
        self.assertEqual(group, '0')

        # A second --init leaves the users alone and prints no new password.
        rc, out = velmor(self.root, '--init')
        self.assertEqual(rc, 0, out)
        self.assertNotIn('Demo login', out)
        self.assertEqual([l for l in read(users).splitlines() if l.startswith('demo,')], lines)

        # Another installation gets another password.
        other = tempfile.mkdtemp(prefix='velmor-users-')
        self.addCleanup(shutil.rmtree, other, ignore_errors=True)
        rc, out = velmor(other, '--init')
        self.assertNotIn(password, out)

        # The line demo.sh shows is kept private and current.
        login = os.path.join(self.root, 'demo-login')
        self.assertEqual(stat.S_IMODE(os.stat(login).st_mode), 0o600)
        self.assertEqual(read(login), 'Demo login: demo  password: %s\n' % password)
        rc, out = velmor(self.root, '--passwd', 'demo', '--password', 'Newer-Secret-7')
        self.assertEqual(rc, 0, out)
        self.assertEqual(read(login), 'Demo login: demo  password: Newer-Secret-7\n')


def pop_login(suite, user, password):
    """True when the POP3 server lets `user` in with `password`."""
    pop = poplib.POP3('127.0.0.1', suite.port('pop'), timeout=10)
    try:
        pop.user(user)
        pop.pass_(password)
        pop.quit()
        return True
    except poplib.error_proto:
        return False
    finally:
        pop.close()


class UserAdministration(SuiteTestCase):
    def change_pass(self, user, old, new):
        rc, out = self.suite.ctl('change pass %s %s %s' % (user, old, new))
        return out.strip()

    def test_an_added_user_reads_mail_over_pop3(self):
        root = self.suite.path('')
        rc, out = velmor(root, '--adduser', 'dora', '--password', 'first', '--full-name', 'Dora Maar')
        self.assertEqual(rc, 0, out)
        self.assertTrue(pop_login(self.suite, 'dora', 'first'))
        self.assertTrue(pop_login(self.suite, 'd.maar', 'first'))
        self.assertFalse(pop_login(self.suite, 'dora', 'First'))
        self.assertFalse(pop_login(self.suite, 'nobody', 'first'))
        rc, out = velmor(root, '--passwd', 'dora', stdin='second\n')
        self.assertEqual(rc, 0, out)
        self.assertFalse(pop_login(self.suite, 'dora', 'first'))
        self.assertTrue(pop_login(self.suite, 'dora', 'second'))

    def test_added_users_authenticate_and_change_their_password(self):
        root = self.suite.path('')
        users = self.suite.path('config/users')

        # Added while the suite runs: it is told to reload at once.
        rc, out = velmor(root, '--adduser', 'alice', '--password', 'first',
                         '--full-name', 'Alice Liddell', '--group', '0')
        self.assertEqual(rc, 0, out)
        self.assertEqual(self.change_pass('alice', 'wrong', 'second'), '1')
        self.assertEqual(self.change_pass('nobody', 'first', 'second'), '1')
        self.assertEqual(self.change_pass('ALICE', 'first', 'second'), '2')
        self.assertEqual(self.change_pass('a.liddell', 'second', 'third'), '2')
        self.assertEqual(self.change_pass('alice', 'second', 'fourth'), '1')
        self.assertEqual(stat.S_IMODE(os.stat(users).st_mode), 0o600)
        self.assertTrue(os.path.exists(users + '~'))

        # A password from standard input; the same user cannot be added twice.
        rc, out = velmor(root, '--passwd', 'alice', stdin='fifth\n')
        self.assertEqual(rc, 0, out)
        self.assertEqual(self.change_pass('alice', 'fifth', 'sixth'), '2')
        rc, out = velmor(root, '--adduser', 'Alice', '--password', 'x')
        self.assertEqual(rc, 1)
        self.assertIn('exists already', out)

        # Fields the file cannot carry are refused and the file is unchanged.
        before = read(users, 'rb')
        rc, out = velmor(root, '--adduser', 'bob', '--password', 'x', '--full-name', 'Bob, Jr')
        self.assertEqual(rc, 1)
        self.assertIn('comma', out)
        rc, out = velmor(root, '--passwd', 'nobody', '--password', 'x')
        self.assertEqual(rc, 1)
        self.assertEqual(read(users, 'rb'), before)

        # A line added by hand counts after "reload users".
        with open(users, 'a') as f:
            f.write('carol,%s,Carol,%s,0\n' % (crypt_hash('handmade', 'ab12'), root))
        self.assertEqual(self.change_pass('carol', 'handmade', 'x'), '1')
        self.suite.ctl('reload users')
        self.assertEqual(self.change_pass('carol', 'wrong', 'x'), '1')
        self.assertEqual(self.change_pass('carol', 'handmade', 'new'), '2')

        # Removed users can no longer authenticate.
        rc, out = velmor(root, '--deluser', 'carol')
        self.assertEqual(rc, 0, out)
        self.assertEqual(self.change_pass('carol', 'new', 'x'), '1')
        self.assertIn('Loading user database', self.suite.log('main'))


class MissingGroupsFile(unittest.TestCase):
    def test_starts_and_refuses_without_a_default_group(self):
        suite = Suite()
        self.addCleanup(suite.cleanup)
        os.remove(suite.path('config/groups'))
        suite.start()
        try:
            self.assertIn('User group file missing', suite.log('main'))
            rc, out = velmor(suite.root, '--adduser', 'erin', '--password', 'pw')
            self.assertEqual(rc, 0, out)
            self.assertFalse(pop_login(suite, 'erin', 'pw'))
        finally:
            suite.stop()


if __name__ == '__main__':
    unittest.main()

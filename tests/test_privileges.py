"""Started as root with server.user set, the suite binds its listeners and
then runs as that user; `cmake --install` lays out a tree that does so."""

import glob
import os
import poplib
import pwd
import smtplib
import subprocess
import shutil
import tempfile
import time
import unittest

from harness import Suite, VELMOR_BIN


@unittest.skipUnless(os.geteuid() == 0, 'switching users needs root')
class RunAsServerUser(unittest.TestCase):
    def test_the_suite_runs_as_its_user_and_mail_goes_round(self):
        nobody = pwd.getpwnam('nobody')
        suite = Suite(config={'server.user': 'nobody', 'mail.domains': 'example.test'})
        self.addCleanup(suite.cleanup)
        # What the installation step does: the tree belongs to the suite's user.
        subprocess.run(['chown', '-hR', '%d:%d' % (nobody.pw_uid, nobody.pw_gid), suite.root], check=True)
        Suite._run([VELMOR_BIN, '--root', suite.root, '--adduser', 'ann', '--password', 'pw-4711'])
        self.assertEqual(os.stat(suite.path('config/users')).st_uid, nobody.pw_uid)
        suite.start()
        with open('/proc/%d/status' % suite.proc.pid) as f:
            ids = [line.split()[1:] for line in f if line.startswith(('Uid:', 'Gid:'))]
        self.assertEqual(ids, [[str(nobody.pw_uid)] * 4, [str(nobody.pw_gid)] * 4])

        with smtplib.SMTP('127.0.0.1', suite.port('smtp'), timeout=10) as smtp:
            smtp.sendmail('bob@elsewhere.test', ['ann@example.test'], b'Subject: hi\r\n\r\nround trip\r\n')
        inbox = suite.path('home/ann/mail/inbox')
        deadline = time.monotonic() + 15
        while not os.path.exists(inbox):
            self.assertLess(time.monotonic(), deadline, suite.log('main'))
            suite.ctl('maildebatch')
            time.sleep(0.05)
        p = poplib.POP3('127.0.0.1', suite.port('pop'), timeout=10)
        p.user('ann')
        p.pass_('pw-4711')
        self.assertIn(b'round trip', p.retr(1)[1])
        p.quit()
        self.assertEqual(suite.stop(), 0)
        self.assertFalse(os.path.exists(suite.pid_file))
        self.assertFalse(os.path.exists(suite.path('run/control')))


class Install(unittest.TestCase):
    def test_cmake_install_lays_out_a_tree_and_a_unit_that_run_as_velmor(self):
        build = os.path.dirname(VELMOR_BIN)
        if not os.path.exists(os.path.join(build, 'cmake_install.cmake')):
            self.skipTest('not a build folder')
        dest = tempfile.mkdtemp(prefix='velmor-install-')
        self.addCleanup(shutil.rmtree, dest, True)
        r = subprocess.run(['cmake', '--install', build], env=dict(os.environ, DESTDIR=dest),
                           capture_output=True, text=True, timeout=120)
        self.assertEqual(r.returncode, 0, r.stdout + r.stderr)
        units = glob.glob(os.path.join(dest, '**/systemd/system/velmor.service'), recursive=True)
        with open(units[0]) as f:
            unit = f.read()
        for line in ('Type=simple', 'User=velmor', 'AmbientCapabilities=CAP_NET_BIND_SERVICE'):
            self.assertIn('\n%s\n' % line, unit)
        binary = unit.split('\nExecStart=', 1)[1].split()[0]
        self.assertTrue(os.path.isfile(dest + binary), binary)
        with open(os.path.join(dest, 'usr/local/velmor/config/master')) as f:
            self.assertIn('\n%server.user: velmor\n', f.read())


if __name__ == '__main__':
    unittest.main()

"""`cmake --install` into a staging folder, as a package build does it."""

import os
import re
import shutil
import subprocess
import tempfile
import unittest

from harness import VELMOR_BIN

BUILD = os.path.dirname(VELMOR_BIN)


class StagedInstall(unittest.TestCase):

    @classmethod
    def setUpClass(cls):
        if not os.path.exists(os.path.join(BUILD, 'cmake_install.cmake')) or not shutil.which('cmake'):
            raise unittest.SkipTest('no cmake build folder beside %s' % VELMOR_BIN)
        cls.stage = tempfile.mkdtemp(prefix='velmor-stage-')
        r = subprocess.run(['cmake', '--install', BUILD, '--prefix', '/usr/local'], env=dict(os.environ,
                           DESTDIR=cls.stage), stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True,
                           timeout=300)
        cls.install_output = r.stdout
        if r.returncode != 0:
            shutil.rmtree(cls.stage, True)
            raise AssertionError('cmake --install failed:\n' + r.stdout)

    @classmethod
    def tearDownClass(cls):
        shutil.rmtree(cls.stage, True)

    def staged(self, path):
        return os.path.join(self.stage, path.lstrip('/'))

    def test_no_staging_path_and_no_demo_user(self):
        stage = self.stage.encode()
        files = 0
        for folder, _, names in os.walk(self.stage):
            for name in names:
                path = os.path.join(folder, name)
                if os.path.islink(path):
                    self.assertNotIn(stage, os.readlink(path).encode(), path)
                    continue
                files += 1
                with open(path, 'rb') as f:
                    self.assertNotIn(stage, f.read(), path)
        self.assertGreater(files, 10)
        root = self.staged('/usr/local/velmor')
        with open(os.path.join(root, 'config/users')) as f:
            self.assertFalse([line for line in f if line.startswith('demo,')])
        self.assertFalse(os.path.exists(os.path.join(root, 'demo-login')))
        self.assertFalse(os.path.exists(os.path.join(root, 'home/demo')))

    def test_manual_pages_name_every_key(self):
        for page in ('man8/velmor.8', 'man8/velmorctl.8', 'man5/velmor-master.5'):
            self.assertTrue(os.path.isfile(self.staged('/usr/local/share/man/' + page)), page)
        with open(self.staged('/usr/local/share/man/man5/velmor-master.5')) as f:
            documented = set(re.findall(r'(?m)^\.B (\S+)$', f.read().replace('\\-', '-')))
        with open(self.staged('/usr/local/velmor/config/master')) as f:
            keys = {line[1:].split(':', 1)[0].lower() for line in f if line.startswith('%')}
        self.assertEqual(keys - documented, set())

    def test_unit_runs_the_suite_in_the_foreground(self):
        unit = self.staged('/usr/local/lib/systemd/system/velmor.service')
        with open(unit) as f:
            text = f.read()
        self.assertIn('Type=simple\n', text)
        self.assertIn('ExecStart=/usr/local/bin/velmor --root /usr/local/velmor\n', text)
        if not shutil.which('systemd-analyze'):
            self.skipTest('systemd-analyze is not installed')
        # The binary is checked where it is staged; the unit is otherwise as installed.
        with tempfile.TemporaryDirectory() as d:
            copy = os.path.join(d, 'velmor.service')
            with open(copy, 'w') as f:
                f.write(text.replace('ExecStart=/usr/local/bin/velmor',
                                     'ExecStart=' + self.staged('/usr/local/bin/velmor')))
            r = subprocess.run(['systemd-analyze', 'verify', copy], stdout=subprocess.PIPE,
                               stderr=subprocess.STDOUT, text=True, timeout=60)
        self.assertEqual(r.returncode, 0, r.stdout)


if __name__ == '__main__':
    unittest.main()

"""Start-up, the pid file, the quit signals, the crash line and --init."""

import os
import re
import signal
import socket
import subprocess
import shutil
import tempfile
import time
import unittest

from harness import Suite, SuiteTestCase, VELMOR_BIN, wait_for

STARTUP_CONSOLE = [
    'Velmor Server Suite starting...',
    'Loading config file',
    'loaded config',
    'initing filecache',
    'Initing logger',
    'logging on...',
]
STARTUP_LOG = [
    '++++++++++++++++++++++++++++++ Starting ++++++++++++++++++++++++++++++++',
    'Logger started',
    'Config loaded',
    'File cache initialised',
    'Loading MIME mapping table',
    'Suite started: 2.0.49',
]
# The shutdown lines in their order; the ones of subsystems that are built
# must appear in this order, the core ones always.
SHUTDOWN_ORDER = ['Shutting down', 'Shutting down dialler', 'Shutting down news', 'Shutting down proxy',
                  'Shutting down sockets', 'Shutting down filecache', 'Shutting down logger']
SHUTDOWN_CORE = ['Shutting down', 'Shutting down filecache', 'Shutting down logger']
REFUSAL = 'Velmor server is already running, or has died messily - cannot start new server'


def log_texts(text):
    """The message part of each main-log line (after the time stamp)."""
    return [line.split(' -> ', 1)[1] for line in text.splitlines() if ' -> ' in line]


def assert_in_order(case, wanted, lines):
    positions = []
    for w in wanted:
        case.assertIn(w, lines, 'missing %r in %r' % (w, lines))
        positions.append(lines.index(w))
    case.assertEqual(positions, sorted(positions), lines)


class StartAndStop(unittest.TestCase):
    def setUp(self):
        self.suite = Suite()
        self.addCleanup(self.suite.cleanup)

    def run_velmor(self, *args, timeout=20):
        return subprocess.run([VELMOR_BIN, '--root', self.suite.root] + list(args), stdin=subprocess.DEVNULL,
                              stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True, timeout=timeout)

    def test_startup_names_its_ports_and_a_crash_leaves_nothing_in_the_way(self):
        s = self.suite.start()
        console = s.output().splitlines()
        self.assertEqual(console[:len(STARTUP_CONSOLE)], STARTUP_CONSOLE)
        for name, title in (('smtp', 'SMTP'), ('pop', 'POP3')):
            self.assertIn('Listening for %s on 127.0.0.1:%d' % (title, s.port(name)), console)
        assert_in_order(self, STARTUP_LOG, log_texts(s.log('main')))
        with open(s.pid_file) as f:
            self.assertEqual(f.read(), str(s.proc.pid))  # decimal, no newline

        # A crash leaves its pid file behind; the next start replaces it.
        dead = s.proc.pid
        s.kill()
        self.assertTrue(os.path.exists(s.pid_file))
        s.start()
        replaced = 'Replaced the pid file of a suite that is no longer running (process %d)' % dead
        self.assertIn(replaced, s.output().splitlines())
        self.assertTrue(wait_for(lambda: replaced + ': ' + s.pid_file in log_texts(s.log('main'))))

        # A live one still keeps a second instance out, without touching the log.
        starts = log_texts(s.log('main')).count(STARTUP_LOG[0])
        second = self.run_velmor('--bind', '127.0.0.1')
        self.assertEqual((second.returncode, second.stdout), (1, REFUSAL + '\n'))
        self.assertEqual(log_texts(s.log('main')).count(STARTUP_LOG[0]), starts)
        self.assertIsNone(s.proc.poll(), 'the first instance must keep running')

        self.assertEqual(s.stop(), 0)
        self.assertFalse(os.path.exists(s.pid_file))

    def test_each_quit_signal_runs_the_shutdown(self):
        for signum in (signal.SIGHUP, signal.SIGINT, signal.SIGQUIT, signal.SIGTERM):
            with self.subTest(signal=signum.name):
                if os.path.exists(self.suite.path('logs/main')):
                    os.truncate(self.suite.path('logs/main'), 0)
                self.suite.start()
                self.suite.signal(signum)
                self.assertEqual(self.suite.wait(), 0)
                self.assertFalse(os.path.exists(self.suite.pid_file))
                lines = log_texts(self.suite.log('main'))
                shutdown = [l for l in lines if l in SHUTDOWN_ORDER]
                self.assertEqual(shutdown, [l for l in SHUTDOWN_ORDER if l in shutdown])
                for line in SHUTDOWN_CORE:
                    self.assertIn(line, shutdown)

    def test_crash_line_on_sigsegv(self):
        s = self.suite.start()
        s.signal(signal.SIGSEGV)
        s.wait()
        self.assertRegex(s.output(), r'(?m)^\+\*\+\*\+\*\+\*\+\*\+\* seg fault:\d+$')
        self.assertRegex(s.log('errors'), r'(?m)^\d\d:\d\d:\d\d, \d\d \w+ -> \+\*\+\*\+\*\+\*\+\*\+\* seg fault:\d+$')

    def test_a_port_in_use_stops_start_up(self):
        s = self.suite.start()
        listening = []
        for port in s.ports.values():
            try:
                socket.create_connection(('127.0.0.1', port), timeout=2).close()
                listening.append(port)
            except OSError:
                pass
        self.assertEqual(s.stop(), 0)
        if not listening:
            self.skipTest('no listening service is built yet')
        with socket.socket() as taken:
            # A listener holds the port even against SO_REUSEADDR; the option
            # only lets this test's bind past connections still closing.
            taken.setsockopt(socket.SOL_SOCKET, socket.SO_REUSEADDR, 1)
            taken.bind(('127.0.0.1', listening[0]))
            taken.listen()
            r = self.run_velmor('--bind', '127.0.0.1')
        self.assertEqual(r.returncode, 1)
        self.assertEqual(r.stdout.splitlines()[-1], 'Socket initialisation failed - see logs for more info')
        self.assertRegex(r.stdout, r'(?m)^Cannot listen for \S+ on 127\.0\.0\.1:%d: Address already in use$'
                         % listening[0])
        self.assertIn('Bind Failed - is another server running on this port: %d' % listening[0],
                      self.suite.log('errors'))
        self.assertFalse(os.path.exists(self.suite.pid_file))

    def test_missing_configuration(self):
        os.remove(self.suite.path('config/master'))
        r = self.run_velmor()
        self.assertEqual(r.returncode, 1)
        self.assertEqual(r.stdout.splitlines(), [
            'Velmor Server Suite starting...',
            'Loading config file',
            'Couldn\'t open config file:%s' % self.suite.path('config/master'),
            'Config load faile d',
            'No master configuration in %s: make a default installation with: velmor --root %s --init'
            % (self.suite.root, self.suite.root),
        ])
        self.assertFalse(os.path.exists(self.suite.pid_file))

    def test_missing_log_configuration(self):
        os.remove(self.suite.path('config/logs'))
        r = self.run_velmor()
        self.assertEqual(r.returncode, 1)
        self.assertEqual(r.stdout.splitlines()[-2:], [
            "couldn't open log config file:'config/logs'", 'logger init failed'])
        self.assertFalse(os.path.exists(self.suite.pid_file))


class InternalCommands(SuiteTestCase):
    def wait_for_log(self, text, timeout=10):
        deadline = time.monotonic() + timeout
        while text not in self.suite.log('main'):
            self.assertLess(time.monotonic(), deadline, self.suite.log('main'))
            time.sleep(0.05)

    def test_words_are_logged_and_a_transfer_dials_while_the_link_is_down(self):
        for word in ('NEWSKICK', 'mailtransfer'):
            self.assertEqual(self.suite.ctl(word)[0], 0)
        self.wait_for_log('Internal command: mailtransfer')
        self.wait_for_log('Mail transfer - connecting...')
        lines = log_texts(self.suite.log('main'))
        self.assertIn('Internal command: NEWSKICK', lines)
        self.assertNotIn('Mail transfer - connected, and starting transfer', lines)


class Init(unittest.TestCase):
    def setUp(self):
        self.root = tempfile.mkdtemp(prefix='velmor-init-')
        self.addCleanup(shutil.rmtree, self.root, True)

    def init(self, *args, env=None):
        return subprocess.run([VELMOR_BIN, '--root', self.root, '--init'] + list(args), stdin=subprocess.DEVNULL,
                              stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True, timeout=20, env=env)

    def master(self):
        keys = {}
        with open(os.path.join(self.root, 'config/master')) as f:
            for line in f:
                if line.startswith('%'):
                    k, _, v = line[1:].partition(':')
                    keys[k] = v.strip()
        return keys

    def test_fresh_installation_and_existing_files_kept(self):
        r = self.init()
        self.assertEqual(r.returncode, 0)
        for d in ('logs', 'tmp', 'run', 'mail/in', 'mail/out', 'mail/odd', 'home'):
            self.assertTrue(os.path.isdir(os.path.join(self.root, d)), d)
        keys = self.master()
        self.assertEqual(len(keys), 253)
        self.assertEqual([keys[k] for k in ('smtp.sock.port', 'pop.sock.port', 'imap.sock.port', 'nntp.sock.port',
                                            'web.sock.port', 'proxy.http.sock.port')],
                         ['2525', '1110', '1143', '1119', '8000', '8080'])
        self.assertNotIn('@', keys['server.name'])
        self.assertNotEqual(keys['server.name'], 'unknown')
        self.assertEqual(keys['mail.domains'], keys['server.name'] + ', localhost')
        self.assertEqual(keys['sock.buffer'], '16384')
        with open(os.path.join(self.root, 'config/templates/master')) as f:
            self.assertEqual(f.read().count('\n%'), 253)
        # Switched on, and named, are exactly the services this build runs;
        # --help names the same with their ports.
        named = re.search(r'(?m)^Services: (.*)$', r.stdout).group(1).split(', ')
        titles = {'SMTP': 'smtp', 'POP3': 'pop', 'IMAP': 'imap', 'NNTP': 'nntp', 'WEB SERVER': 'web', 'SMTPS': 'smtps',
                  'SUBMISSION': 'submission', 'POP3S': 'pops', 'IMAPS': 'imaps'}
        on = {k[:-len('.sock.enabled')] for k, v in keys.items() if k.endswith('.enabled') and v == 'yes'}
        self.assertEqual({titles[n.rsplit(' port ', 1)[0].upper()] for n in named}, on)
        self.assertIn('smtp', on)
        usage = subprocess.run([VELMOR_BIN, '--help'], stdout=subprocess.PIPE, text=True, timeout=10).stdout
        self.assertEqual(sorted(n.replace(' port ', ' ') for n in named),
                         sorted(re.search(r'unprivileged ports \(([^)]*)\)', usage.replace('\n', ' '))
                                .group(1).split(', ')))

        path = os.path.join(self.root, 'config/mimemap')
        with open(path, 'w') as f:
            f.write('mine\n')
        self.assertEqual(self.init('--standard-ports').returncode, 0)
        with open(path) as f:
            self.assertEqual(f.read(), 'mine\n')
        self.assertEqual(self.master()['smtp.sock.port'], '2525')

    def test_standard_ports_and_the_host_name_from_the_environment(self):
        env = dict(os.environ, **{'inet$hostname': 'gateway', 'inet$localdomain': 'example.org'})
        self.assertEqual(self.init('--standard-ports', env=env).returncode, 0)
        keys = self.master()
        self.assertEqual(keys['server.name'], 'gateway.example.org')
        self.assertEqual(keys['mail.domains'], 'gateway.example.org, localhost')
        self.assertEqual([keys[k] for k in ('smtp.sock.port', 'pop.sock.port', 'imap.sock.port', 'nntp.sock.port',
                                            'web.sock.port', 'smtps.sock.port', 'submission.sock.port',
                                            'pops.sock.port', 'imaps.sock.port')],
                         ['25', '110', '143', '119', '80', '465', '587', '995', '993'])

    def test_help_version_and_bad_options(self):
        r = subprocess.run([VELMOR_BIN, '--version'], stdout=subprocess.PIPE, text=True, timeout=10)
        self.assertEqual((r.returncode, r.stdout), (0, 'velmor 2.0.49 [Linux/i386]\n'))
        r = subprocess.run([VELMOR_BIN, '--help'], stdout=subprocess.PIPE, text=True, timeout=10)
        self.assertEqual(r.returncode, 0)
        self.assertIn('--root DIR', r.stdout)
        for bad in (['--bogus'], ['--root'], ['--bind', 'example.org'], ['--standard-ports']):
            r = subprocess.run([VELMOR_BIN] + bad, stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True,
                               timeout=10)
            self.assertEqual(r.returncode, 2, bad)


if __name__ == '__main__':
    unittest.main()

"""End-to-end harness: a private Velmor installation on free loopback ports.

    s = Suite(config={'smtp.sock.max': '2'})
    s.start()                 # waits until the suite answers
    smtplib.SMTP('127.0.0.1', s.port('smtp'))
    s.ctl('listmq')           # -> (returncode, stdout) of velmorctl
    s.stop()                  # SIGTERM; returns the exit status

Every wait has a time-out; stop() and the test case's tearDown always end the
daemon, also when a test fails. The daemon's console output is kept in
<root>/daemon.out for debugging.
"""

import os
import re
import shutil
import signal
import socket
import subprocess
import tempfile
import threading
import time
import unittest

HERE = os.path.dirname(os.path.abspath(__file__))
TOP = os.path.dirname(HERE)


def _binary(env_name, name):
    path = os.environ.get(env_name)
    if path:
        return os.path.abspath(path)  # the daemon runs in its installation folder
    for build in ('build', 'build-release'):
        candidate = os.path.join(TOP, build, name)
        if os.path.exists(candidate):
            return candidate
    return os.path.join(TOP, 'build', name)


VELMOR_BIN = _binary('VELMOR_BIN', 'velmor')
VELMORCTL_BIN = _binary('VELMORCTL_BIN', 'velmorctl')

# Keys of the listeners that get a free port; the upstream proxy's port is not
# one of ours.
_PORT_KEY = re.compile(r'^%([a-z.]+)\.sock\.port\s*:', re.IGNORECASE)
_NOT_OURS = {'proxy.external'}


def wait_for(predicate, timeout=5.0, interval=0.05):
    """Polls `predicate` until it is true or `timeout` seconds pass; its last value."""
    deadline = time.monotonic() + timeout
    while time.monotonic() < deadline:
        if predicate():
            return True
        time.sleep(interval)
    return predicate()


def free_port():
    """A TCP and UDP port on 127.0.0.1 that nobody uses right now."""
    while True:
        with socket.socket(socket.AF_INET, socket.SOCK_STREAM) as s:
            s.bind(('127.0.0.1', 0))
            port = s.getsockname()[1]
        try:
            with socket.socket(socket.AF_INET, socket.SOCK_DGRAM) as u:
                u.bind(('127.0.0.1', port))
        except OSError:
            continue
        return port


def set_keys(path, values):
    """Rewrites the master file at `path` with `values` (key -> text): a key
    already in the file has its line and continuation lines replaced, a new
    key is appended."""
    with open(path, encoding='utf-8', errors='surrogateescape') as f:
        lines = f.read().splitlines()
    wanted = {k.lower(): (k, v) for k, v in values.items()}
    out, skipping = [], False
    for line in lines:
        if line.startswith('%'):
            key = line[1:].split(':', 1)[0].strip().lower()
            skipping = key in wanted
            if skipping:
                k, v = wanted.pop(key)
                out.append('%%%s: %s' % (k, v))
                continue
        elif skipping and line[:1] not in ('|', ''):
            continue  # a continuation line of a replaced key
        else:
            skipping = False
        out.append(line)
    out.extend('%%%s: %s' % (k, v) for k, v in wanted.values())
    with open(path, 'w', encoding='utf-8', errors='surrogateescape') as f:
        f.write('\n'.join(out) + '\n')


class FakeServer:
    """A TCP server of a test's own, in a thread: each connection it accepts
    on `address` (a free port of 127.0.0.1 unless given) goes to
    session(conn) in turn, with a 10-s time-out, and is closed after it; a
    connection that breaks ends its session quietly. Subclasses set their
    fields before calling this constructor, which starts serving."""

    def __init__(self, address=('127.0.0.1', 0)):
        self.sock = socket.socket()
        self.sock.setsockopt(socket.SOL_SOCKET, socket.SO_REUSEADDR, 1)
        self.sock.bind(address)
        self.sock.listen(8)
        self.sock.settimeout(0.2)
        self.port = self.sock.getsockname()[1]
        self._stop = False
        self._thread = threading.Thread(target=self._serve, daemon=True)
        self._thread.start()

    def _serve(self):
        while not self._stop:
            try:
                conn, _ = self.sock.accept()
            except socket.timeout:
                continue
            except OSError:
                return
            with conn:
                conn.settimeout(10)
                try:
                    self.session(conn)
                except (OSError, EOFError):  # ssl.SSLError is an OSError
                    pass

    def session(self, conn):
        raise NotImplementedError

    def close(self):
        self._stop = True
        self._thread.join(5)
        self.sock.close()


class Suite:
    """One private installation and its daemon."""

    def __init__(self, config=None, init_args=(), bind='127.0.0.1'):
        """`bind` is the one address the listeners use (a test's network
        namespace may need another than loopback)."""
        self.root = tempfile.mkdtemp(prefix='velmor-e2e-')
        self.bind = bind
        self.proc = None
        self._out = None
        self.init_output = self._run([VELMOR_BIN, '--root', self.root, '--init'] + list(init_args))
        self.ports = {}
        master = self.path('config/master')
        with open(master, encoding='utf-8', errors='surrogateescape') as f:
            for line in f:
                m = _PORT_KEY.match(line)
                if m and m.group(1).lower() not in _NOT_OURS:
                    self.ports[m.group(1).lower()] = free_port()
        values = {'%s.sock.port' % name: str(port) for name, port in self.ports.items()}
        values.update(config or {})
        set_keys(master, values)

    @staticmethod
    def _run(args, timeout=30):
        r = subprocess.run(args, stdin=subprocess.DEVNULL, stdout=subprocess.PIPE,
                           stderr=subprocess.STDOUT, timeout=timeout, text=True)
        if r.returncode != 0:
            raise RuntimeError('%s failed (%d):\n%s' % (' '.join(args), r.returncode, r.stdout))
        return r.stdout

    # ---- paths and ports -------------------------------------------------
    def path(self, relative):
        return os.path.join(self.root, relative)

    @property
    def pid_file(self):
        return self.path('run/velmor.pid')

    def port(self, name):
        """The port chosen for <name>.sock.port ('smtp', 'pop', 'proxy.http', ...)."""
        return self.ports[name.lower()]

    def log(self, name):
        try:
            with open(self.path('logs/' + name), encoding='utf-8', errors='replace') as f:
                return f.read()
        except FileNotFoundError:
            return ''

    def output(self):
        """What the daemon printed on its console so far."""
        try:
            with open(self.path('daemon.out'), encoding='utf-8', errors='replace') as f:
                return f.read()
        except FileNotFoundError:
            return ''

    # ---- the daemon --------------------------------------------------------
    def spawn(self, *extra):
        """Starts the daemon without waiting for it."""
        self._close_out()
        self._out = open(self.path('daemon.out'), 'ab')
        self.proc = subprocess.Popen([VELMOR_BIN, '--root', self.root, '--bind', self.bind] + list(extra),
                                     stdin=subprocess.DEVNULL, stdout=self._out, stderr=subprocess.STDOUT,
                                     cwd=self.root)
        return self.proc

    def start(self, timeout=20):
        """Starts the daemon and waits until it is ready: the pid file names
        it (written after the listeners are open) and, when velmorctl is built,
        the control channel answers "test"."""
        for attempt in range(3):
            seen = len(self.output())
            self.spawn()
            deadline = time.monotonic() + timeout
            while time.monotonic() < deadline:
                if self.proc.poll() is not None:
                    # A free port is only free until somebody takes it: another
                    # test running beside this one may have, so choose again.
                    if attempt < 2 and 'Address already in use' in self.output()[seen:]:
                        self._choose_ports_again()
                        break
                    raise RuntimeError('velmor exited with %d:\n%s' % (self.proc.returncode, self.output()))
                if self._pid_file_is_ours() and self._answers():
                    return self
                time.sleep(0.05)
            else:
                self.kill()
                raise RuntimeError('velmor did not become ready:\n' + self.output())
        raise RuntimeError('velmor found no free ports:\n' + self.output())

    def _choose_ports_again(self):
        master = self.path('config/master')
        with open(master, encoding='utf-8', errors='surrogateescape') as f:
            text = f.read()
        values = {}
        for name, port in self.ports.items():
            if re.search(r'(?m)^%%%s\.sock\.port\s*:\s*%d\s*$' % (re.escape(name), port), text):
                self.ports[name] = free_port()
                values['%s.sock.port' % name] = str(self.ports[name])
        set_keys(master, values)

    def _pid_file_is_ours(self):
        # A file left by a killed suite names another process until it is replaced.
        try:
            with open(self.pid_file) as f:
                return f.read().strip() == str(self.proc.pid)
        except OSError:
            return False

    def _answers(self):
        if not os.path.exists(VELMORCTL_BIN):
            return True
        rc, out = self.ctl('test', timeout=5)
        return rc == 0 and out.startswith('test:')

    def ctl(self, command, timeout=10, raw=False):
        """Runs velmorctl --root R COMMAND -> (returncode, stdout); with `raw`,
        the suite's replies as they came (status: "is:...")."""
        r = subprocess.run([VELMORCTL_BIN, '--root', self.root] + (['--raw'] if raw else []) + [command],
                           stdin=subprocess.DEVNULL, stdout=subprocess.PIPE, stderr=subprocess.STDOUT,
                           timeout=timeout, text=True)
        return r.returncode, r.stdout

    def signal(self, signum):
        self.proc.send_signal(signum)

    def wait(self, timeout=20):
        """Waits for the daemon to end; returns its exit status (negative for a
        signal). Kills it when it does not end in time."""
        try:
            status = self.proc.wait(timeout=timeout)
        except subprocess.TimeoutExpired:
            self.kill()
            raise
        self._close_out()
        return status

    def stop(self, timeout=20):
        """SIGTERM, wait, return the exit status."""
        if self.proc is None:
            return None
        if self.proc.poll() is None:
            self.proc.send_signal(signal.SIGTERM)
        return self.wait(timeout)

    def kill(self):
        if self.proc is not None and self.proc.poll() is None:
            self.proc.kill()
            try:
                self.proc.wait(timeout=10)
            except subprocess.TimeoutExpired:
                pass
        self._close_out()

    def _close_out(self):
        if self._out is not None:
            self._out.close()
            self._out = None

    def cleanup(self):
        """Ends the daemon if it still runs and removes the installation."""
        self.kill()
        if os.environ.get('VELMOR_KEEP_ROOT'):
            print('kept', self.root)
        else:
            shutil.rmtree(self.root, ignore_errors=True)


class SuiteTestCase(unittest.TestCase):
    """self.suite is started in setUp with the class's `config` overrides and
    always ended in tearDown."""

    config = {}

    def setUp(self):
        self.suite = Suite(config=dict(self.config))
        self.addCleanup(self.suite.cleanup)
        self.suite.start()

    def tearDown(self):
        if self.suite.proc is not None and self.suite.proc.poll() is None:
            self.suite.stop()

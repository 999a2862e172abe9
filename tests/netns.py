"""A peer outside the site's own network, for tests of what strangers may do.

    with netns.PublicPeer() as peer:              # skips the test unless root
        suite = Suite(config=..., bind=peer.host_ip)
        suite.start()
        replies = peer.talk(suite.port('smtp'), ['HELO x', 'VRFY demo', 'QUIT'])
        result = peer.run(any_function, arg, ...)  # runs inside the namespace

The namespace (unique name) is joined to the root namespace by a veth pair:
the suite's end gets `host_ip` and the client's end `peer_ip`, a /30 of
198.51.100.0/24 (a documentation range, so public rather than private).
Everything is removed again on leaving the block, also when a test fails.
"""
import ctypes
import fcntl
import os
import pickle
import select
import shutil
import signal
import socket
import subprocess
import unittest

_CLONE_NEWNET = 0x40000000
_LOCK = '/run/lock/velmor-netns.lock'
_counter = 0


def _ip(*args, check=True):
    return subprocess.run(['ip'] + list(args), stdin=subprocess.DEVNULL, capture_output=True,
                          text=True, timeout=20, check=check)


def available():
    """Why a namespace cannot be made here, or None when it can."""
    if os.geteuid() != 0:
        return 'network namespaces need root'
    if not shutil.which('ip'):
        return 'the ip tool is not installed'
    if _ip('netns', 'list', check=False).returncode != 0:
        return 'ip netns is not available'
    return None


class PublicPeer:
    """A network namespace whose client end has a public-range address."""

    def __init__(self):
        global _counter
        _counter += 1
        tag = '%d_%d' % (os.getpid(), _counter)
        self.name = 'velmor-test-' + tag
        self.host_if, self.peer_if = 'vh' + tag, 'vp' + tag  # at most 15 characters
        self.host_ip = self.peer_ip = None

    def __enter__(self):
        why = available()
        if why:
            raise unittest.SkipTest(why)
        try:
            self._create()
        except BaseException:
            self.close()
            raise
        return self

    def __exit__(self, *exc):
        self.close()

    def _create(self):
        os.makedirs(os.path.dirname(_LOCK), exist_ok=True)
        # Chosen and assigned under a lock, so parallel runs never share a /30.
        with open(_LOCK, 'w') as lock:
            fcntl.flock(lock, fcntl.LOCK_EX)
            used = _ip('-o', '-4', 'addr', 'show').stdout
            for k in range(64):
                host, peer = '198.51.100.%d' % (4 * k + 1), '198.51.100.%d' % (4 * k + 2)
                if (' %s/' % host) not in used and (' %s/' % peer) not in used:
                    break
            else:
                raise RuntimeError('no free /30 left in 198.51.100.0/24')
            _ip('netns', 'add', self.name)
            _ip('link', 'add', self.host_if, 'type', 'veth', 'peer', 'name', self.peer_if)
            _ip('link', 'set', self.peer_if, 'netns', self.name)
            _ip('addr', 'add', host + '/30', 'dev', self.host_if)
            _ip('link', 'set', self.host_if, 'up')
            self.host_ip, self.peer_ip = host, peer
        _ip('-n', self.name, 'addr', 'add', peer + '/30', 'dev', self.peer_if)
        _ip('-n', self.name, 'link', 'set', self.peer_if, 'up')
        _ip('-n', self.name, 'link', 'set', 'lo', 'up')

    def close(self):
        _ip('netns', 'del', self.name, check=False)  # takes both veth ends with it
        _ip('link', 'del', self.host_if, check=False)

    def run(self, function, *args, timeout=30):
        """Calls function(*args) in a child process inside the namespace and
        returns its result; an exception there is raised here."""
        reader, writer = os.pipe()
        pid = os.fork()
        if pid == 0:  # the child: never returns into the test runner
            os.close(reader)
            try:
                fd = os.open('/run/netns/' + self.name, os.O_RDONLY)
                if ctypes.CDLL(None, use_errno=True).setns(fd, _CLONE_NEWNET) != 0:
                    raise OSError(ctypes.get_errno(), 'setns failed')
                outcome = (True, function(*args))
            except BaseException as e:  # handed to the parent
                outcome = (False, e)
            try:
                data = pickle.dumps(outcome)
            except Exception as e:
                data = pickle.dumps((False, RuntimeError('unpicklable result: %r' % e)))
            with os.fdopen(writer, 'wb') as w:
                w.write(data)
            os._exit(0)
        os.close(writer)
        data = b''
        try:
            with os.fdopen(reader, 'rb') as r:
                while True:
                    ready, _, _ = select.select([r], [], [], timeout)
                    if not ready:
                        os.kill(pid, signal.SIGKILL)
                        raise TimeoutError('the client in %s did not finish' % self.name)
                    chunk = os.read(r.fileno(), 65536)
                    if not chunk:
                        break
                    data += chunk
        finally:
            os.waitpid(pid, 0)
        ok, value = pickle.loads(data)
        if not ok:
            raise value
        return value

    def talk(self, port, lines, host=None, timeout=10):
        """A line dialogue from inside the namespace with a server at `host`
        (the suite's end by default): the greeting, then one reply line per
        item sent. Each item is sent with CR LF behind it; an item may hold
        several lines (a message after DATA, ending in ".")."""
        return self.run(_talk, host or self.host_ip, port, list(lines), timeout)


def _talk(host, port, lines, timeout):
    with socket.create_connection((host, port), timeout=timeout) as s:
        f = s.makefile('rb')
        replies = [f.readline().decode('latin-1').rstrip('\r\n')]
        for line in lines:
            s.sendall(line.encode('latin-1') + b'\r\n')
            replies.append(f.readline().decode('latin-1').rstrip('\r\n'))
        return replies

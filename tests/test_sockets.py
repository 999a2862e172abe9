"""The dispatcher seen from outside: connection limits, idle time-outs and
thousands of idle connections, through the SMTP service."""

import resource
import socket
import time
import unittest

from harness import SuiteTestCase


class SmtpSuiteTestCase(SuiteTestCase):
    """Runs once the SMTP service is part of the daemon."""

    def setUp(self):
        super().setUp()
        try:
            socket.create_connection(('127.0.0.1', self.suite.port('smtp')), timeout=2).close()
        except OSError:
            self.skipTest('the SMTP service is not built into this daemon yet')


def connect(port, timeout=5.0):
    return socket.create_connection(('127.0.0.1', port), timeout=timeout)


def greeting(sock, timeout):
    """The first line the server sends, or '' when nothing comes in time."""
    sock.settimeout(timeout)
    try:
        return sock.recv(4096).decode('latin-1')
    except socket.timeout:
        return ''


class ConnectionLimitTest(SmtpSuiteTestCase):
    config = {'smtp.sock.max': '2'}

    def test_a_third_client_waits_and_is_served_without_reconnecting(self):
        port = self.suite.port('smtp')
        first, second = connect(port), connect(port)
        self.assertTrue(greeting(first, 5).startswith('220 '))
        self.assertTrue(greeting(second, 5).startswith('220 '))
        third = connect(port)  # lands in the backlog
        self.assertEqual(greeting(third, 1.0), '')
        first.sendall(b'QUIT\r\n')
        self.assertTrue(greeting(first, 5).startswith('221 '))
        first.close()
        self.assertTrue(greeting(third, 5).startswith('220 '))
        third.sendall(b'NOOP\r\n')
        self.assertEqual(greeting(third, 5), '250 OK\r\n')
        second.close()
        third.close()


class IdleTimeoutTest(SmtpSuiteTestCase):
    config = {'smtp.sock.timeout': '1'}

    def test_a_silent_client_is_dropped(self):
        c = connect(self.suite.port('smtp'))
        self.assertTrue(greeting(c, 5).startswith('220 '))
        start = time.monotonic()
        c.settimeout(10)
        self.assertEqual(c.recv(4096), b'')  # closed by the suite
        self.assertLess(time.monotonic() - start, 5)
        c.close()

    def test_a_client_that_trickles_bytes_is_dropped_too(self):
        c = connect(self.suite.port('smtp'))
        self.addCleanup(c.close)
        self.assertTrue(greeting(c, 5).startswith('220 '))
        c.settimeout(0.3)
        deadline = time.monotonic() + 10
        try:
            while True:  # a byte every 0.3 s, never a whole line
                self.assertLess(time.monotonic(), deadline, 'a client sending single bytes kept its slot')
                c.send(b'N')
                try:
                    if c.recv(100) == b'':
                        break
                except socket.timeout:
                    pass
        except ConnectionError:
            pass  # reset by the suite

class ManyIdleConnectionsTest(SmtpSuiteTestCase):
    config = {'smtp.sock.max': '3000', 'smtp.sock.timeout': '600'}

    def test_two_thousand_idle_clients_and_the_control_channel_answers_at_once(self):
        soft, hard = resource.getrlimit(resource.RLIMIT_NOFILE)
        if hard < 2500:
            self.skipTest('descriptor limit too low')
        resource.setrlimit(resource.RLIMIT_NOFILE, (max(soft, 2500), hard))
        self.addCleanup(resource.setrlimit, resource.RLIMIT_NOFILE, (soft, hard))
        port = self.suite.port('smtp')
        clients = []
        self.addCleanup(lambda: [c.close() for c in clients])
        for _ in range(2000):
            clients.append(connect(port))
        # Every one of them is served: the last greeting arrives.
        self.assertTrue(greeting(clients[-1], 10).startswith('220 '))
        with socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM) as s:
            s.bind('')
            s.settimeout(2)
            start = time.monotonic()
            s.sendto(b'test', self.suite.path('run/control'))
            self.assertTrue(s.recv(100).startswith(b'test:'))
            self.assertLess(time.monotonic() - start, 0.5)
        # And a new client still gets its answers.
        late = connect(port)
        self.assertTrue(greeting(late, 5).startswith('220 '))
        late.sendall(b'NOOP\r\n')
        self.assertEqual(greeting(late, 5), '250 OK\r\n')
        late.close()


if __name__ == '__main__':
    unittest.main()

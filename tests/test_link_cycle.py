"""The dial-up mail transfer end to end: "mailtransfer" with the link down
dials a fake modem, the script runs, the first answer of a name server on
loopback proves the link, the transfer runs, and the dialler hangs up."""

import os
import re
import unittest

from dns_server import NameServer, response, test_address
from fake_modem import FakeModem
from harness import Suite, wait_for as wait_briefly

LINK = 0x10000       # status bit: the link is up
DIALLER_ON = 0x8000  # status bit: the dialler has a script running or is on line


def wait_for(predicate):
    return wait_briefly(predicate, timeout=20.0)


class MailTransferCycleTest(unittest.TestCase):

    def setUp(self):
        replies = {b'ATZ': b'\r\nOK\r\n', b'ATDT5551234': b'\r\nCONNECT 33600\r\n\r\nlogin: '}
        self.modem = FakeModem(replies.get)
        self.addCleanup(self.modem.hang_up)
        # The far end of the link answers once the test has brought the link
        # up, and only while the suite holds the line.
        self.link = False
        self.answered = []
        self.server = NameServer(test_address(30), self.answer)
        self.addCleanup(self.server.close)
        self.suite = Suite(config={
            'dialler.driver': 'modem', 'dialler.script': 'config/dial.script',
            'dialler.user': 'demo', 'dialler.phone': '5551234',
            'dialler.discmd': 'echo hung up >> discmd.out',
            'dns.servers': self.server.address, 'dns.timeout': '1', 'dns.retries': '1',
            'store.state': str(2 + 16384)})
        self.addCleanup(self.suite.cleanup)
        os.symlink(self.modem.path, self.suite.path('modem'))
        with open(self.suite.path('config/dial.script'), 'w') as f:
            f.write('i ATZ\nd "ATDT%phone"\nw ogin:\ns %user\nc echo %user > ppp.started\n')
        self.suite.start()

    def on_line(self):
        fds = '/proc/%d/fd' % self.suite.proc.pid
        for fd in os.listdir(fds):
            try:
                if os.readlink(os.path.join(fds, fd)) == self.modem.path:
                    return True
            except OSError:
                pass
        return False

    def answer(self, query):
        if not (self.link and self.on_line()):
            return []
        self.answered.append(query)
        return [(response(query, rcode=3), None)]

    def status(self):
        rc, out = self.suite.ctl('status', raw=True)
        self.assertEqual(rc, 0, out)
        return int(out.split('\n')[0][3:]) & (LINK | DIALLER_ON)

    def main_log(self):
        return self.suite.log('main')

    def logged(self, text):
        return wait_for(lambda: text in self.main_log())

    def hang_ups(self):
        try:
            with open(self.suite.path('discmd.out')) as f:
                return f.read().count('hung up')
        except FileNotFoundError:
            return 0

    def probes_go_unanswered(self):
        seen = len(self.server.queries)
        self.assertTrue(wait_for(lambda: len(self.server.queries) >= seen + 2))

    def test_mailtransfer_dials_waits_for_the_link_and_hangs_up(self):
        self.assertEqual(self.suite.ctl('mailtransfer'), (0, ''))
        self.assertTrue(self.logged('Dialler - script complete'), self.main_log())
        self.assertEqual(self.modem.heard, [b'ATZ', b'ATDT5551234', b'demo'])
        self.assertEqual(self.status(), DIALLER_ON)
        self.probes_go_unanswered()  # the monitor probes for the link
        self.link = True
        self.assertTrue(self.logged('Mail transfer complete, disconnecting'), self.main_log())
        self.assertTrue(wait_for(lambda: self.hang_ups() == 1))

        # The first answer proved the link: a probe for the server's own name.
        probe = self.answered[0]
        self.assertEqual(probe.type, 12)
        self.assertEqual(probe.name, '.'.join(reversed(self.server.address.split('.'))) + '.in-addr.arpa')
        steps = ['Internal command: mailtransfer', 'Mail transfer - connecting...',
                 'Dialler executing script: config/dial.script', 'Dialler: Dialling:ATDT%phone',
                 'Dialler: Executing string: echo %user > ppp.started', 'Dialler - script complete',
                 'DNS - Network link established', 'Mail transfer - connected, and starting transfer',
                 'Disconnecting. Online for 0 minutes, ', 'Mail transfer complete, disconnecting']
        log = self.main_log()
        at = [log.find(step) for step in steps]
        self.assertEqual(at, sorted(at), log)
        self.assertNotIn(-1, at, log)
        self.assertRegex(log, re.compile(r'Disconnecting\. Online for 0 minutes, \d+ seconds?\.\n'))
        self.assertTrue(wait_for(lambda: os.path.exists(self.suite.path('ppp.started'))))

        # Once hung up the link is down and stays down: probes go unanswered.
        self.assertEqual(self.status(), 0)
        self.probes_go_unanswered()
        self.assertEqual(self.main_log().count('DNS - Network link established'), 1)
        self.assertEqual(self.status(), 0)

    def test_failed_dial_and_disconnect_while_waiting_for_the_link(self):
        os.unlink(self.suite.path('modem'))
        self.suite.ctl('mailtransfer')
        failed = 'Serial driver (modem) open failed:No such file or directory'
        self.assertTrue(self.logged(failed), self.main_log())
        self.assertIn(failed, self.suite.output())
        self.assertEqual(self.status(), 0)

        # A later request dials again; "disconnect" while it waits for the
        # link hangs up.
        os.symlink(self.modem.path, self.suite.path('modem'))
        self.suite.ctl('mailtransfer')
        self.assertTrue(self.logged('Dialler - script complete'), self.main_log())
        self.suite.ctl('disconnect')
        self.assertTrue(self.logged('Disconnecting. Online for 0 minutes, '))
        self.assertTrue(wait_for(lambda: self.hang_ups() == 1))
        self.assertEqual(self.status(), 0)
        self.assertIsNone(self.suite.proc.poll())


if __name__ == '__main__':
    unittest.main()

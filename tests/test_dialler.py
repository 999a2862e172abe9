"""The dialler against a fake modem on a pseudo-terminal, driven through velmorctl."""

import os
import unittest

from fake_modem import FakeModem
from harness import Suite, wait_for as wait_briefly


def wait_for(predicate):
    # A script takes a step every half second; a few steps, with room to spare.
    return wait_briefly(predicate, timeout=20.0)


class DiallerTest(unittest.TestCase):

    def start(self, answer, script, **keys):
        self.modem = FakeModem(answer)
        self.addCleanup(self.modem.hang_up)
        config = {'dialler.driver': self.modem.path, 'dialler.script': 'config/dial.script',
                  'dialler.user': 'demo', 'dialler.phone': '5551234', 'dialler.timeout': '300',
                  'dialler.discmd': 'echo hung up >> discmd.out', 'store.state': str(2 + 16384)}
        config.update(keys)
        self.suite = Suite(config=config)
        self.addCleanup(self.suite.cleanup)
        self.script(script)
        self.suite.start()

    def script(self, text):
        with open(self.suite.path('config/dial.script'), 'w') as f:
            f.write(text)

    def logged(self, text, name='main'):
        return wait_for(lambda: text in self.suite.log(name))

    def read(self, name):
        try:
            with open(self.suite.path(name)) as f:
                return f.read()
        except FileNotFoundError:
            return ''

    def hang_ups(self):
        return self.read('discmd.out').count('hung up')

    def test_login_dialogue_refuses_unsafe_values_and_never_logs_the_password(self):
        canary = self.id() + '.canary'
        password = 'x;touch ' + canary
        replies = {b'ATZ': b'ATZ\r\r\nOK\r\n',  # the command echoed, then OK
                   # The login prompt arrives with CONNECT and has no line end.
                   b'ATDT5551234': b'\r\nCONNECT 115200\r\n\r\nWelcome\r\nlogin: ',
                   b'demo': b'Password: '}
        self.start(lambda line: replies.get(line, b'\r\nhello\r\n'),
                   'Init ATZ\r\n'
                   '# the provider\r\n'
                   'dial "ATDT%phone"\r\n'
                   'w ogin:\r\n'
                   's %user\r\n'
                   'w assword:\r\n'
                   's %pass\r\n'
                   'c echo %user %idle > dialled\r\n'
                   'c echo %pass > leaked\r\n',
                   **{'dialler.pass': password})
        self.suite.ctl('connect')
        self.assertTrue(self.logged('Dialler - script complete'), self.suite.log('main'))
        self.assertTrue(self.logged('Dialler - script complete', 'dialler'))
        self.assertEqual(self.modem.heard, [b'ATZ', b'ATDT5551234', b'demo', password.encode()])
        self.assertTrue(wait_for(lambda: self.read('dialled') == 'demo 300\n'))
        self.assertIn('Refusing shell command: unsafe value in %pass', self.suite.log('main'))
        self.assertIn('Dialling:ATDT%phone', self.suite.log('main'))

        # "disconnect" hangs up and runs dialler.discmd.
        self.suite.ctl('disconnect')
        self.assertTrue(self.logged('Disconnecting. Online for 0 minutes, '))
        self.assertTrue(wait_for(lambda: self.hang_ups() == 1))

        # Shutdown while on line hangs up the same way.
        self.script('d "ATDT%phone"\n')
        self.suite.ctl('connect')
        self.assertTrue(wait_for(lambda: self.suite.log('main').count('Dialler - script complete') == 2))
        self.assertEqual(self.suite.stop(), 0)
        main = self.suite.log('main')
        self.assertEqual(main.count('Disconnecting. Online for'), 2, main)
        self.assertLess(main.index('Shutting down dialler'), main.rindex('Disconnecting. Online for'))
        self.assertTrue(wait_for(lambda: self.hang_ups() == 2))

        self.assertFalse(os.path.exists(self.suite.path(canary)))
        self.assertFalse(os.path.exists(self.suite.path('leaked')))
        for name in os.listdir(self.suite.path('logs')):
            self.assertNotIn(password, self.suite.log(name), name)
        self.assertNotIn(password, self.suite.output())

    def test_no_link_after_connect_hangs_up_after_linktime(self):
        self.start(lambda line: b'\r\nCONNECT 33600\r\n' if line.startswith(b'ATDT') else None,
                   'd ATDT%phone\n', **{'dialler.linktime': '2'})
        self.suite.ctl('connect')
        self.assertTrue(self.logged('Dialler - script complete'))
        self.assertTrue(self.logged('Disconnecting. Online for 0 minutes, '), self.suite.log('main'))
        self.assertTrue(self.logged('Disconnecting. Online for', 'dialler'))
        self.assertTrue(wait_for(lambda: self.hang_ups() == 1))
        self.assertEqual(self.modem.heard, [b'ATDT5551234'])

    def test_busy_three_times_goes_idle_and_a_lost_carrier_hangs_up(self):
        result = {'reply': b'\r\nBUSY\r\n'}
        self.start(lambda line: result['reply'] if line.startswith(b'ATDT') else None,
                   'd ATDT%phone\n', **{'dialler.retries': '2', 'dialler.retrytime': '1'})
        self.suite.ctl('connect')
        self.assertTrue(self.logged('Dialler - modem reported line busy, going idle'), self.suite.log('main'))
        main = self.suite.log('main')
        self.assertIn('Dialler - modem reported line busy. Retries left: 1\n', main)
        self.assertIn('Dialler - modem reported line busy. Retries left: 0\n', main)
        self.assertIn('Resetting modem.', main)
        self.assertEqual(self.modem.heard, [b'ATDT5551234'] * 3)

        result['reply'] = b'\r\nCONNECT\r\n'
        self.suite.ctl('connect')
        self.assertTrue(self.logged('Dialler - script complete'))
        self.modem.hang_up()
        self.assertTrue(self.logged('Modem has hung up - dialler going idle.'), self.suite.log('main'))
        self.assertTrue(self.logged('Disconnecting. Online for'))
        self.assertTrue(wait_for(lambda: self.hang_ups() == 1))
        self.assertIsNone(self.suite.proc.poll())


if __name__ == '__main__':
    unittest.main()

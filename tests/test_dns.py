"""The resolver and the link monitor, driven by `velmorctl lookup` against
name servers on 127/8 addresses of port 53: one written here, and dnsmasq
checked against dig."""

import os
import shutil
import socket
import subprocess
import tempfile
import time
import unittest

from dns_server import NameServer, encode_name, question_for, response, rr, test_address
from harness import Suite

LINK = 0x10000


def wait_for(predicate, timeout=15.0):
    deadline = time.monotonic() + timeout
    while time.monotonic() < deadline:
        if predicate():
            return True
        time.sleep(0.05)
    return predicate()


class ResolverCase(unittest.TestCase):
    @classmethod
    def serve(cls, address, handler):
        server = NameServer(address, handler)
        cls.addClassCleanup(server.close)
        return server

    @classmethod
    def bound(cls, address, port):
        s = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
        cls.addClassCleanup(s.close)
        s.bind((address, port))
        return s

    @classmethod
    def start_suite(cls, servers, **keys):
        config = {'dns.servers': ', '.join(servers), 'dns.timeout': '1', 'dns.retries': '1',
                  'dns.search': 'corp.test'}
        config.update(keys)
        cls.suite = Suite(config=config)
        cls.addClassCleanup(cls.suite.cleanup)
        cls.suite.start()
        cls.suite.ctl('log dns')
        if not wait_for(lambda: cls.link_bit()):
            raise RuntimeError('the link never came up:\n' + cls.suite.log('main'))

    @classmethod
    def link_bit(cls):
        rc, out = cls.suite.ctl('status', raw=True)
        return rc == 0 and int(out.split('\n')[0][3:]) & LINK

    @classmethod
    def tearDownClass(cls):
        cls.suite.stop()

    def lookup(self, name):
        rc, out = self.suite.ctl('lookup ' + name, timeout=30)
        self.assertEqual(rc, 0, out)
        prefix = 'lookup:%s:' % name
        self.assertTrue(out.startswith(prefix), out)
        return out[len(prefix):].strip()


class LookupTest(ResolverCase):
    """Two servers written here; what each name gets is in `answer`."""

    @classmethod
    def setUpClass(cls):
        cls.s1, cls.s2 = test_address(1), test_address(2)
        cls.forger = cls.bound(test_address(3), 53)
        cls.wrong_port = cls.bound(cls.s1, 0)
        cls.asked = {}
        cls.serve(cls.s1, lambda q: cls.answer(1, q))
        cls.serve(cls.s2, lambda q: cls.answer(2, q))
        cls.start_suite([cls.s1, cls.s2])

    @classmethod
    def answer(cls, server, q):
        name = q.name.lower()
        n = cls.asked[name] = cls.asked.get(name, 0) + 1
        a = lambda address, owner=q.name, ttl=300: rr(owner, 1, address, ttl)
        ok = lambda *records, **kw: [(response(q, records, **kw), None)]
        if name.endswith('.in-addr.arpa'):
            return ok(rcode=3)  # the link probes
        if name in ('plain.example', '163.com'):
            return ok(a('10.1.0.1'))
        if name == 'host':
            return ok(rcode=3)
        if name == 'host.corp.test':
            return ok(a('10.1.0.2'))
        if name == 'nothere.example':
            return ok(rcode=3)
        if name == 'loop.example':
            return ok(rr(q.name, 5, 'loop2.example'), rr('loop2.example', 5, 'loop.example'))
        if name == 'second.example':
            return ok(a('10.1.0.14')) if server == 2 else []
        if name == 'glue.example':
            return [(response(q, [a('10.1.0.10')], authority=[rr('example', 2, 'other.example')],
                              additional=[a('6.6.6.7', 'other.example')]), None)]
        if name == 'other.example':
            return ok(a('10.1.0.11'))
        if name in ('short.example', 'long.example'):
            return ok(a('10.1.0.12', ttl=1 if name == 'short.example' else 300))
        if name == 'forged.example':
            fake = [a('6.6.6.6')]
            return [(response(q, fake, qid=q.id ^ 1), None),
                    (response(q, fake), cls.forger),
                    (response(q, fake), cls.wrong_port),
                    (response(q, fake, question=question_for('forged.example.evil')), None),
                    (response(q, [a('10.1.0.9')]), None)]
        if name.startswith('bad-'):
            # Malformed the first time, sound when asked again (by the other server).
            if n > 1:
                return ok(a('10.1.0.3'))
            good = a('10.1.0.3')
            if name == 'bad-counts.example':
                return [(response(q, [good], counts=(3, 0, 0)), None)]
            if name == 'bad-rdlength.example':
                return [(response(q, [good[:-6] + b'\x00\x40' + good[-4:]], counts=(1, 0, 0)), None)]
            if name == 'bad-pointer.example':
                at = 12 + len(q.question)  # the owner name points at itself
                self_pointer = bytes([0xc0 | (at >> 8), at & 0xff])
                return [(response(q, [self_pointer + good[len(encode_name(q.name)):]]), None)]
            if name == 'bad-a8.example':
                return [(response(q, [rr(q.name, 1, socket.inet_aton('10.9.9.9') * 2)]), None)]
        return []  # silence

    def test_answers_repeats_and_dotted_quads(self):
        self.assertEqual(self.lookup('plain.example'), '10.1.0.1')
        self.assertEqual(self.lookup('long.example'), '10.1.0.12')
        self.assertEqual(self.lookup('LONG.example'), '10.1.0.12')
        self.assertEqual(self.asked['long.example'], 1)  # the cache answered the repeat
        self.assertEqual(self.lookup('10.2.3.4'), '10.2.3.4')
        self.assertNotIn('10.2.3.4', self.asked)
        self.assertEqual(self.lookup('163.com'), '10.1.0.1')  # a name, not an address

    def test_silence_and_the_second_server(self):
        self.assertEqual(self.lookup('silent.example'), 'failed')
        self.assertEqual(self.asked['silent.example'], 2)  # each server once
        self.assertEqual(self.lookup('second.example'), '10.1.0.14')

    def test_name_errors_with_and_without_the_search_domain(self):
        self.assertEqual(self.lookup('host'), '10.1.0.2')
        self.assertEqual(self.asked['host'], 1)
        self.assertEqual(self.lookup('host'), '10.1.0.2')  # from the cache, under the searched name
        self.assertEqual(self.asked['host.corp.test'], 1)
        # A name error fails at once: the second server is never asked.
        self.assertEqual(self.lookup('nothere.example'), 'failed')
        self.assertEqual(self.asked['nothere.example'], 1)

    def test_cname_loop_fails_every_time(self):
        self.assertEqual(self.lookup('loop.example'), 'failed')
        self.assertEqual(self.lookup('loop.example'), 'failed')
        self.assertEqual(self.lookup('plain.example'), '10.1.0.1')

    def test_malformed_answers_are_dropped(self):
        for name in ('bad-counts.example', 'bad-rdlength.example', 'bad-pointer.example', 'bad-a8.example'):
            self.assertEqual(self.lookup(name), '10.1.0.3', name)
            self.assertEqual(self.asked[name], 2, name)

    def test_forged_answers_are_dropped(self):
        self.assertEqual(self.lookup('forged.example'), '10.1.0.9')
        log = self.suite.log('main')
        self.assertIn('Received unknown id', log)
        self.assertIn('Bad reply', log)

    def test_only_the_answer_chain_is_cached(self):
        self.assertEqual(self.lookup('glue.example'), '10.1.0.10')
        self.assertEqual(self.lookup('other.example'), '10.1.0.11')
        self.assertEqual(self.asked['other.example'], 1)

    def test_ttl_expiry(self):
        self.assertEqual(self.lookup('short.example'), '10.1.0.12')
        self.assertTrue(wait_for(lambda: self.lookup('short.example') == '10.1.0.12'
                                 and self.asked['short.example'] >= 2, timeout=10))


class LinkMonitorTest(ResolverCase):
    """The link goes down when the server falls silent and comes back when
    it answers again; answers forged from another address revive nothing."""

    @classmethod
    def setUpClass(cls):
        cls.forger = cls.bound(test_address(11), 53)
        cls.silent = False
        cls.forged = 0
        cls.serve(test_address(10), cls.answer)
        cls.start_suite([test_address(10)])

    @classmethod
    def answer(cls, q):
        if cls.silent:
            cls.forged += 1
            return [(response(q, rcode=3), cls.forger)]
        return [(response(q, [rr(q.name, 1, '10.1.0.1')] if q.type == 1 else [], rcode=0 if q.type == 1 else 3),
                 None)]

    def test_link_down_and_up(self):
        self.assertEqual(self.lookup('up.example'), '10.1.0.1')
        type(self).silent = True
        self.assertEqual(self.lookup('down.example'), 'failed')
        self.assertTrue(wait_for(lambda: not self.link_bit(), timeout=20), self.suite.log('main'))
        self.assertIn('DNS - Network link broken', self.suite.log('main'))
        seen = self.forged
        self.assertTrue(wait_for(lambda: self.forged >= seen + 3))  # probes go on, forgers answer
        self.assertFalse(self.link_bit())
        self.assertEqual(self.lookup('up.example'), 'failed')  # nothing is sent while the link is down
        type(self).silent = False
        self.assertTrue(wait_for(lambda: self.link_bit(), timeout=10))
        self.assertEqual(self.lookup('up.example'), '10.1.0.1')


@unittest.skipUnless(shutil.which('dnsmasq') and shutil.which('dig'), 'needs dnsmasq and dig')
class DnsmasqTest(ResolverCase):
    """dnsmasq as a plain upstream: `lookup` agrees with dig."""

    names = ('alpha.test', 'www.test', 'deep.test', 'beta.test', 'missing.test')

    @classmethod
    def setUpClass(cls):
        cls.address = test_address(20)
        cls.tmp = tempfile.mkdtemp(prefix='velmor-dnsmasq-')
        cls.dnsmasq = subprocess.Popen(
            ['dnsmasq', '--conf-file=/dev/null', '--no-resolv', '--no-hosts', '--bind-interfaces',
             '--listen-address=' + cls.address, '--port=53', '--keep-in-foreground',
             '--pid-file=' + os.path.join(cls.tmp, 'pid'), '--host-record=alpha.test,10.3.0.1',
             '--host-record=beta.test,10.3.0.2', '--cname=www.test,alpha.test', '--cname=deep.test,www.test'],
            stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
        cls.addClassCleanup(cls.stop_dnsmasq)
        if not wait_for(lambda: cls.dig('alpha.test') == '10.3.0.1'):
            raise RuntimeError('dnsmasq did not answer')
        cls.start_suite([cls.address])

    @classmethod
    def stop_dnsmasq(cls):
        cls.dnsmasq.terminate()
        try:
            cls.dnsmasq.wait(10)
        except subprocess.TimeoutExpired:
            cls.dnsmasq.kill()
            cls.dnsmasq.wait(10)
        shutil.rmtree(cls.tmp, ignore_errors=True)

    @classmethod
    def dig(cls, name):
        r = subprocess.run(['dig', '@' + cls.address, '+short', '+time=1', '+tries=1', name, 'A'],
                           stdout=subprocess.PIPE, stderr=subprocess.DEVNULL, text=True, timeout=10)
        lines = [line for line in r.stdout.split('\n') if line and line[0].isdigit()]
        return lines[-1] if lines else 'failed'

    def test_lookup_agrees_with_dig(self):
        for name in self.names:
            self.assertEqual(self.lookup(name), self.dig(name), name)
        self.assertEqual(self.lookup('deep.test'), '10.3.0.1')


if __name__ == '__main__':
    unittest.main()

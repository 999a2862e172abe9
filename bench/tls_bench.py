"""TLS cost, Velmor against Dovecot on one certificate (an EC P-256 key,
as `velmor --init` makes): handshakes a second on the POP3-over-TLS port
(connect, handshake, read the greeting, close), then the POP3 and IMAP
read benchmarks' whole mailbox over TLS from the first byte.

Run through bench/tls.sh, which installs Dovecot when it is missing."""

import os
import socket
import ssl
import subprocess
import sys
import tempfile
import time

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(os.path.dirname(HERE), 'tests'))
sys.path.insert(0, HERE)
import imap_bench  # noqa: E402
import pop3_bench  # noqa: E402
from pop3_bench import MESSAGES, make_messages, run_dovecot, run_velmor  # noqa: E402

HANDSHAKES = int(os.environ.get('TLS_BENCH_HANDSHAKES', '2000'))


def make_pair(folder):
    cert, key = os.path.join(folder, 'cert.pem'), os.path.join(folder, 'key.pem')
    subprocess.run(['openssl', 'req', '-x509', '-newkey', 'ec', '-pkeyopt', 'ec_paramgen_curve:P-256',
                    '-nodes', '-subj', '/CN=localhost', '-days', '30', '-keyout', key, '-out', cert],
                   check=True, stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
    return cert, key


def tls_connector(cert):
    context = ssl.create_default_context(cafile=cert)
    context.check_hostname = False  # the name is localhost, the address 127.0.0.1

    def connect(port, timeout):
        return context.wrap_socket(socket.create_connection(('127.0.0.1', port), timeout=timeout))
    return connect


def handshakes(port, user, label):
    """HANDSHAKES full handshakes, one after another, each reading the
    greeting; returns handshakes a second (best of three runs)."""
    connect = pop3_bench.connect
    connect(port, 10).close()
    rates = []
    for _ in range(3):
        start = time.perf_counter()
        for _ in range(HANDSHAKES):
            s = connect(port, 10)
            if not s.recv(512).startswith(b'+OK'):
                raise RuntimeError('%s: no greeting' % label)
            s.close()
        rates.append(HANDSHAKES / (time.perf_counter() - start))
    print('%-8s %d handshakes: best %.0f/s of %s' % (label, HANDSHAKES, max(rates),
                                                     ', '.join('%.0f' % r for r in rates)))
    return max(rates)


def main():
    with tempfile.TemporaryDirectory() as folder:
        cert, key = make_pair(folder)
        os.chmod(folder, 0o755)
        pop3_bench.connect = tls_connector(cert)
        keys = {'tls.cert': cert, 'tls.key': key, 'pops.sock.max': '50', 'imaps.sock.timeout': '300'}
        messages = imap_bench.with_parts(make_messages(MESSAGES))

        ours = run_velmor(messages[:1], 'pops', handshakes, keys)
        theirs = run_dovecot(messages[:1], 'pop3', handshakes, (cert, key))
        print('handshakes: velmor %.0f/s, dovecot %.0f/s: velmor makes %.2fx the handshakes of dovecot\n'
              % (ours, theirs, ours / theirs))

        results = []
        for name, service, protocol, read in (('POP3S', 'pops', 'pop3', pop3_bench.best_of),
                                              ('IMAPS', 'imaps', 'imap', imap_bench.best_of)):
            ours = run_velmor(messages, service, read, keys)
            theirs = run_dovecot(messages, protocol, read, (cert, key))
            results.append('%s: velmor %.3f s, dovecot %.3f s: velmor takes %.2fx the time of dovecot'
                           % (name, ours, theirs, ours / theirs))
            print(results[-1] + '\n')
        print('\n'.join(results))


if __name__ == '__main__':
    main()

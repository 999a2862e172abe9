"""2,000 IMAP clients in IDLE on one mailbox, on Velmor and on Dovecot's
IMAP server, for a minute with one delivery a second: memory of the whole
server (RSS, and PSS, which counts shared pages once), its CPU time over the
minute, and the delay from each delivery to the EXISTS every client hears
(median and worst). Velmor takes its mail over SMTP and delivers it at
"maildebatch"; Dovecot's mail is put into the Maildir as a delivery agent
does (written to tmp/, renamed into new/); one imap process per client, as
Dovecot runs by default, each looking at the mailbox every second once the
kernel's inotify instances for the user run out. Prints the ratios.

Run through bench/imap_idle.sh, which installs Dovecot when it is missing."""

import os
import resource
import selectors
import smtplib
import socket
import statistics
import subprocess
import sys
import threading
import time

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(os.path.dirname(HERE), 'tests'))
import dovecot  # noqa: E402
from harness import Suite, VELMOR_BIN  # noqa: E402

CLIENTS = int(os.environ.get('IDLE_BENCH_CLIENTS', '2000'))
SECONDS = int(os.environ.get('IDLE_BENCH_SECONDS', '60'))
PASSWORD = 'bench-pass'


def message(n):
    return ('From: bob@elsewhere.test\r\nTo: bench@example.test\r\nSubject: idle %d\r\n'
            'Message-ID: <%d.idle@elsewhere.test>\r\n\r\nnew mail number %d\r\n' % (n, n, n)).encode()


def tree(root):
    """The process and all its descendants."""
    children = {}
    for pid in os.listdir('/proc'):
        if not pid.isdigit():
            continue
        try:
            with open('/proc/%s/stat' % pid) as f:
                ppid = int(f.read().rsplit(')', 1)[1].split()[1])
        except (OSError, IndexError, ValueError):
            continue
        children.setdefault(ppid, []).append(int(pid))
    out, todo = [], [root]
    while todo:
        p = todo.pop()
        out.append(p)
        todo.extend(children.get(p, []))
    return out


def cpu_seconds(root):
    """User and system time of the server's processes, with their reaped children's."""
    tick = os.sysconf('SC_CLK_TCK')
    total = 0
    for pid in tree(root):
        try:
            with open('/proc/%d/stat' % pid) as f:
                fields = f.read().rsplit(')', 1)[1].split()
            total += sum(int(x) for x in fields[11:15])
        except OSError:
            pass
    return total / tick


def memory_kb(root):
    """(RSS, PSS) summed over the server's processes, in kilobytes."""
    rss = pss = 0
    for pid in tree(root):
        try:
            with open('/proc/%d/smaps_rollup' % pid) as f:
                for line in f:
                    if line.startswith('Rss:'):
                        rss += int(line.split()[1])
                    elif line.startswith('Pss:'):
                        pss += int(line.split()[1])
        except OSError:
            pass
    return rss, pss


def idle_clients(port, user, count):
    """Connections logged in, INBOX selected, in IDLE (each command waits
    for its answer, as clients do)."""
    socks = []
    for _ in range(count):
        s = socket.create_connection(('127.0.0.1', port), timeout=60)
        f = s.makefile('rb')
        f.readline()
        for command, done in ((b'a LOGIN %s %s' % (user.encode(), PASSWORD.encode()), b'a OK'),
                              (b'b SELECT INBOX', b'b OK'), (b'c IDLE', b'+ ')):
            s.sendall(command + b'\r\n')
            while True:
                line = f.readline()
                if not line or line.startswith((b'a NO', b'a BAD', b'b NO', b'b BAD', b'c BAD')):
                    raise RuntimeError('%r after %d clients' % (line, len(socks)))
                if line.startswith(done):
                    break
        f.close()
        s.setblocking(False)
        socks.append(s)
    return socks


def measure(label, pid, port, user, deliver):
    socks = idle_clients(port, user, CLIENTS)
    sel = selectors.DefaultSelector()
    for i, s in enumerate(socks):
        sel.register(s, selectors.EVENT_READ, [i, b''])
    sent = {}
    heard = {}
    stop = threading.Event()

    def deliveries():
        for n in range(1, SECONDS + 1):
            due = start + n
            while time.monotonic() < due and not stop.is_set():
                time.sleep(min(0.05, max(0.0, due - time.monotonic())))
            if stop.is_set():
                return
            before = time.monotonic()
            sent[n] = deliver(n) or before

    time.sleep(2)  # the set-up settles
    cpu0, start = cpu_seconds(pid), time.monotonic()
    t = threading.Thread(target=deliveries)
    t.start()
    peak = (0, 0)
    last_sample = 0
    try:
        while time.monotonic() < start + SECONDS + 5:
            for key, _ in sel.select(timeout=0.2):
                s, (i, buf) = key.fileobj, key.data
                try:
                    data = s.recv(65536)
                except BlockingIOError:
                    continue
                if not data:
                    raise RuntimeError('%s closed client %d' % (label, i))
                buf += data
                *lines, key.data[1] = buf.split(b'\r\n')
                now = time.monotonic()
                for line in lines:
                    if line.startswith(b'* ') and line.endswith(b' EXISTS'):
                        heard.setdefault(int(line.split()[1]), []).append(now)
            if time.monotonic() - last_sample > 5:
                last_sample = time.monotonic()
                peak = max(peak, memory_kb(pid))
            if len(heard.get(SECONDS, ())) >= CLIENTS:
                break
    finally:
        stop.set()
        t.join()
    cpu = cpu_seconds(pid) - cpu0
    peak = max(peak, memory_kb(pid))
    for s in socks:
        s.close()
    delays = [when - sent[n] for n, times in heard.items() if n in sent for when in times]
    lost = SECONDS * CLIENTS - len(delays)
    print('%-8s %d clients: RSS %.1f MB, PSS %.1f MB, CPU %.2f s in %d s, delivery to EXISTS median %.3f s, '
          'worst %.3f s, %d counts never announced' % (label, CLIENTS, peak[0] / 1024, peak[1] / 1024, cpu, SECONDS,
                                                statistics.median(delays) if delays else -1,
                                                max(delays) if delays else -1, lost))
    return peak, cpu, statistics.median(delays) if delays else float('nan')


def run_velmor():
    suite = Suite(config={'mail.domains': 'example.test', 'imap.sock.max': str(CLIENTS + 50),
                          'smtp.sock.timeout': '300', 'mail.debatch.time': '0'})
    try:
        home = suite.path('home/bench')
        Suite._run([VELMOR_BIN, '--root', suite.root, '--adduser', 'bench', '--password', PASSWORD,
                    '--home', home])
        suite.start()
        smtp = smtplib.SMTP('127.0.0.1', suite.port('smtp'), timeout=30)

        def deliver(n):
            smtp.sendmail('bob@elsewhere.test', ['bench@example.test'], message(n))
            queued = time.monotonic()  # the delivery itself starts now
            suite.ctl('maildebatch')
            return queued

        try:
            return measure('velmor', suite.proc.pid, suite.port('imap'), 'bench', deliver)
        finally:
            smtp.close()
    finally:
        suite.stop()
        suite.cleanup()


def run_dovecot():
    extra = ('mail_max_userip_connections = %d\n'
             'default_process_limit = %d\n'
             'default_client_limit = %d\n'
             # one inotify instance per imap process, and the kernel gives a
             # user 128 by default: the processes past those look each second
             'mailbox_idle_check_interval = 1 secs\n'
             'service imap-login {\n  service_count = 0\n  process_min_avail = 2\n  client_limit = %d\n}\n'
             'service imap {\n  process_limit = %d\n}\n'
             'service anvil {\n  client_limit = %d\n}\n'
             'service auth {\n  client_limit = %d\n}\n'
             % (CLIENTS + 50, CLIENTS + 100, CLIENTS * 2 + 100, CLIENTS + 50, CLIENTS + 50, CLIENTS * 3,
                CLIENTS * 3))
    server = dovecot.Dovecot(password=PASSWORD, protocol='imap', extra=extra)
    try:
        server.fill('bench', [])
        maildir = server.maildir('bench')

        def deliver(n):
            name = '%d.M%dP%d.bench' % (int(time.time()), n, os.getpid())
            tmp = os.path.join(maildir, 'tmp', name)
            with open(tmp, 'wb') as f:
                f.write(message(n))
            os.chown(tmp, 65534, 65534)
            os.rename(tmp, os.path.join(maildir, 'new', name))

        try:
            return measure('dovecot', server.proc.pid, server.port, 'bench', deliver)
        except RuntimeError:
            print(server.log()[-3000:])
            raise
    finally:
        server.close()


def main():
    limit = max(4 * CLIENTS + 1000, resource.getrlimit(resource.RLIMIT_NOFILE)[0])
    resource.setrlimit(resource.RLIMIT_NOFILE, (limit, max(limit, resource.getrlimit(resource.RLIMIT_NOFILE)[1])))
    ours = run_velmor()
    theirs = run_dovecot()
    print('velmor/dovecot: RSS %.4f, PSS %.4f, CPU %.4f, median delay %.4f (dovecot takes %.0fx, %.0fx, %.0fx, %.0fx)' %
          (ours[0][0] / theirs[0][0], ours[0][1] / theirs[0][1], ours[1] / max(theirs[1], 0.01), ours[2] / theirs[2],
           theirs[0][0] / ours[0][0], theirs[0][1] / ours[0][1], theirs[1] / max(ours[1], 0.01), theirs[2] / ours[2]))


if __name__ == '__main__':
    main()

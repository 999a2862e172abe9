"""A private Dovecot POP3 server for the tests and benchmarks: its own
configuration, state and maildirs in a scratch folder, on 127.0.0.1 and a
free port, every user with the same password. The system's own Dovecot
service is never touched.

    d = Dovecot()
    d.fill('ann', [b'Subject: one\\n\\nbody\\n'])
    ... fetch from 127.0.0.1:d.port as ann / d.password ...
    d.left('ann')   # messages still on the server
    d.close()

Dovecot(tls=(cert, key)) also listens with TLS from the first byte on
d.tls_port and offers STARTTLS/STLS on d.port, with that certificate.
"""

import os
import shutil
import socket
import subprocess
import tempfile
import time

from harness import free_port

DOVECOT = shutil.which('dovecot') or '/usr/sbin/dovecot'


def available():
    return os.path.exists(DOVECOT) and os.path.exists('/usr/lib/dovecot/pop3')


class Dovecot:
    def __init__(self, password='dove-pass', protocol='pop3', extra='', tls=None):
        other = 'imap' if protocol == 'pop3' else 'pop3'
        self.password = password
        self.work = tempfile.mkdtemp(prefix='velmor-dovecot-')
        os.chmod(self.work, 0o755)  # the mail processes run as nobody
        self.port = free_port()
        self.tls_port = free_port() if tls else 0
        ssl = 'no'
        if tls:
            # Dovecot reads the pair as root at start-up; copies keep the
            # caller's files out of it.
            for name, source in zip(('cert.pem', 'key.pem'), tls):
                shutil.copyfile(source, os.path.join(self.work, name))
            ssl = 'yes\nssl_cert = <{w}/cert.pem\nssl_key = <{w}/key.pem'.format(w=self.work)
        self.proc = None
        conf = os.path.join(self.work, 'dovecot.conf')
        with open(conf, 'w') as f:
            f.write('''base_dir = {w}/run
state_dir = {w}/state
log_path = {w}/dovecot.log
protocols = {proto}
listen = 127.0.0.1
ssl = {ssl}
disable_plaintext_auth = no
auth_mechanisms = plain
mail_location = maildir:~/Maildir
pop3_uidl_format = %08Xu%08Xv
passdb {{
  driver = static
  args = password={p}
}}
userdb {{
  driver = static
  args = uid=nobody gid=nogroup home={w}/home/%u
}}
service {proto}-login {{
  inet_listener {proto} {{
    address = 127.0.0.1
    port = {port}
  }}
  inet_listener {proto}s {{
    address = 127.0.0.1
    port = {tls_port}
    ssl = yes
  }}
}}
service {other}-login {{
  inet_listener {other} {{
    port = 0
  }}
  inet_listener {other}s {{
    port = 0
  }}
}}
'''.format(w=self.work, p=password, port=self.port, proto=protocol, other=other, ssl=ssl,
           tls_port=self.tls_port) + extra)
        os.makedirs(os.path.join(self.work, 'state'), exist_ok=True)
        os.makedirs(os.path.join(self.work, 'home'), exist_ok=True)
        self.proc = subprocess.Popen([DOVECOT, '-F', '-c', conf], stdout=subprocess.DEVNULL,
                                     stderr=subprocess.STDOUT)
        deadline = time.monotonic() + 20
        while True:
            try:
                socket.create_connection(('127.0.0.1', self.port), timeout=1).close()
                return
            except OSError:
                if time.monotonic() > deadline or self.proc.poll() is not None:
                    log = self.log()
                    self.close()
                    raise RuntimeError('dovecot did not start:\n' + log)
                time.sleep(0.1)

    def log(self):
        try:
            with open(os.path.join(self.work, 'dovecot.log'), errors='replace') as f:
                return f.read()
        except FileNotFoundError:
            return ''

    def maildir(self, user):
        return os.path.join(self.work, 'home', user, 'Maildir')

    def fill(self, user, messages):
        """Replaces `user`'s mailbox with `messages` (bytes, LF line ends),
        in this order."""
        maildir = self.maildir(user)
        shutil.rmtree(os.path.join(self.work, 'home', user), ignore_errors=True)
        for d in ('cur', 'new', 'tmp'):
            os.makedirs(os.path.join(maildir, d))
        for n, text in enumerate(messages, 1):
            name = '%d.M%dP1.velmor:2,' % (1700000000 + n, n)
            with open(os.path.join(maildir, 'cur', name), 'wb') as f:
                f.write(text)
        subprocess.run(['chown', '-R', 'nobody:nogroup', os.path.join(self.work, 'home', user)], check=True)

    def left(self, user):
        """The messages still in `user`'s mailbox."""
        maildir = self.maildir(user)
        return sum(len(os.listdir(os.path.join(maildir, d))) for d in ('cur', 'new'))

    def close(self):
        if self.proc is not None and self.proc.poll() is None:
            self.proc.terminate()
            try:
                self.proc.wait(timeout=20)
            except subprocess.TimeoutExpired:
                self.proc.kill()
                self.proc.wait(timeout=10)
        self.proc = None
        shutil.rmtree(self.work, ignore_errors=True)

"""A modem for the tests: the master side of a pseudo-terminal whose slave
path the suite opens as dialler.driver."""

import os
import select
import threading


class FakeModem(threading.Thread):
    """The master side of a pseudo-terminal; the suite opens the slave's path.
    Every CR-ended line the suite writes is kept in `heard` and answered with
    `answer(line)` (bytes, or None for silence)."""

    def __init__(self, answer):
        super().__init__(daemon=True)
        self.master, self.slave = os.openpty()
        self.path = os.ttyname(self.slave)
        self.answer = answer
        self.heard = []
        self._halt = threading.Event()
        self.start()

    def run(self):
        pending = b''
        while not self._halt.is_set():
            if not select.select([self.master], [], [], 0.05)[0]:
                continue
            try:
                pending += os.read(self.master, 4096)
            except OSError:
                return
            while b'\r' in pending:
                line, pending = pending.split(b'\r', 1)
                self.heard.append(line)
                reply = self.answer(line)
                if reply:
                    os.write(self.master, reply)

    def hang_up(self):
        """Closes the master side: the line is gone."""
        if self.master is None:
            return
        self._halt.set()
        self.join(5)
        os.close(self.master)
        os.close(self.slave)
        self.master = None

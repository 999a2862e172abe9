"""A name server for the tests, in plain Python: UDP on port 53 of a 127/8
address, answering each question as the test tells it.

    server = NameServer('127.53.7.1', handler)   # handler(query) -> list of replies
    server.close()

A reply is (bytes, sender): sender None sends from the server's own socket,
else from the given bound socket (a forger). `query` is a Query with the id,
name, type, the raw datagram and the client's address.
"""

import socket
import struct
import threading


def test_address(slot):
    """A 127/8 address of this test run: distinct per process and slot, so
    runs side by side do not meet."""
    import os
    return '127.53.%d.%d' % (os.getpid() % 250 + 1, slot)


def encode_name(name):
    out = b''
    for label in name.rstrip('.').split('.'):
        if label:
            out += bytes([len(label)]) + label.encode()
    return out + b'\0'


def rr(name, rtype, data, ttl=300, rclass=1):
    """One resource record; `data` is bytes, a dotted quad for A, a name for
    CNAME/PTR/NS, or (preference, host) for MX."""
    if rtype == 1 and isinstance(data, str):
        data = socket.inet_aton(data)
    elif rtype in (2, 5, 12) and isinstance(data, str):
        data = encode_name(data)
    elif rtype == 15 and isinstance(data, tuple):
        data = struct.pack('>H', data[0]) + encode_name(data[1])
    raw = encode_name(name) if isinstance(name, str) else name
    return raw + struct.pack('>HHIH', rtype, rclass, ttl, len(data)) + data


class Query:
    def __init__(self, datagram, client):
        self.raw = datagram
        self.client = client
        self.id = struct.unpack('>H', datagram[:2])[0]
        pos, labels = 12, []
        while datagram[pos]:
            n = datagram[pos]
            labels.append(datagram[pos + 1:pos + 1 + n].decode('ascii', 'replace'))
            pos += 1 + n
        self.name = '.'.join(labels)
        self.question = datagram[12:pos + 5]
        self.type = struct.unpack('>H', datagram[pos + 1:pos + 3])[0]


def response(query, answers=(), authority=(), additional=(), rcode=0, qid=None, question=None,
             counts=None, tc=False):
    """The reply to `query`: its identifier and question unless told
    otherwise; `counts` overrides the record counts (to lie about them)."""
    flags = 0x8180 | rcode | (0x0200 if tc else 0)
    question = query.question if question is None else question
    counts = counts or (len(answers), len(authority), len(additional))
    header = struct.pack('>HHHHHH', query.id if qid is None else qid, flags, 1, *counts)
    return header + question + b''.join(answers) + b''.join(authority) + b''.join(additional)


def question_for(name, rtype=1):
    return encode_name(name) + struct.pack('>HH', rtype, 1)


class NameServer:
    def __init__(self, address, handler):
        self.address = address
        self.handler = handler
        self.queries = []
        self.sock = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
        self.sock.setsockopt(socket.SOL_SOCKET, socket.SO_REUSEADDR, 1)
        self.sock.bind((address, 53))
        self.sock.settimeout(0.2)
        self._stop = False
        self._thread = threading.Thread(target=self._serve, daemon=True)
        self._thread.start()

    def _serve(self):
        while not self._stop:
            try:
                data, client = self.sock.recvfrom(4096)
            except socket.timeout:
                continue
            except OSError:
                return
            try:
                query = Query(data, client)
            except (IndexError, UnicodeError):
                continue
            self.queries.append(query)
            for reply, sender in self.handler(query) or ():
                (sender or self.sock).sendto(reply, client)

    def asked(self, name):
        return [q for q in self.queries if q.name.lower() == name.lower()]

    def close(self):
        self._stop = True
        self._thread.join(5)
        self.sock.close()

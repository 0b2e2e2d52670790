"""A peer that knows nothing but docs/protocol.md: talks to the object of the other side.

Usage: peer.py PORT
"""

import socket
import struct
import sys

NIL = struct.pack("<I", 0)
CALL, NO_MORE_REFS, REPLY = 1, 4, 0xFFFFFFFF
OP_CALL, OP_ADD = 129, 132


def number(value):
    return struct.pack("<Id", 0x300001, value)


def arguments(*values):
    entries = b"".join(number(i) + value for i, value in enumerate(values, 1))
    return struct.pack("<II", 10, len(values)) + entries


class Reader:
    def __init__(self, data):
        self.data = data

    def take(self, form):
        size = struct.calcsize(form)
        part, self.data = self.data[:size], self.data[size:]
        return struct.unpack(form, part)[0]

    def text(self):
        part, self.data = self.data.split(b"\0", 1)
        return part.decode()

    def value(self):
        kind = self.take("<I") & 0xFF
        if kind == 0:
            return None
        if kind == 1:
            return self.take("<d")
        if kind == 2:
            return self.text()
        if kind == 3:
            return self.take("<B") != 0
        if kind == 4:
            assert self.text() == ""
            return {self.value(): self.value() for _ in range(self.take("<I"))}
        if kind == 7:
            return ("object", self.take("<I"), self.take("36s"))
        raise ValueError(f"type {kind}")


class Peer:
    def __init__(self, port):
        self.socket = socket.create_connection(("127.0.0.1", port))
        self.context = 0

    def receive(self, size):
        data = b""
        while len(data) < size:
            part = self.socket.recv(size - len(data))
            assert part, "the connection has ended"
            data += part
        return data

    def ask(self, kind, symbol, target, second=NIL):
        self.context += 1
        size = 32 + len(NIL) + len(second)
        header = struct.pack("<8I", size, kind, symbol, target, self.context, 0, 0, 0)
        self.socket.sendall(header + NIL + second)
        size, kind, _, _, context, _, _, _ = struct.unpack("<8I", self.receive(32))
        assert (kind, context) == (REPLY, self.context), (kind, context)
        reader = Reader(self.receive(size - 32))
        assert reader.value() is None
        result = reader.value()
        assert reader.data == b""
        return result


def main():
    peer = Peer(int(sys.argv[1]))
    assert peer.ask(CALL, OP_CALL, 1, arguments(number(5))) == {-1: 5.0}
    made = peer.ask(CALL, OP_ADD, 1, arguments())[-1]
    assert made[0] == "object" and made[1] > 1
    assert peer.ask(CALL, OP_CALL, made[1], arguments(number(7))) == {-1: 7.0}
    assert peer.ask(NO_MORE_REFS, 0, made[1]) is None
    assert peer.ask(CALL, OP_CALL, made[1], arguments())["Error"] == 10
    assert peer.ask(NO_MORE_REFS, 0, made[1])["Error"] == 6
    assert peer.ask(99, 0, 0)["Error"] == 5
    assert peer.ask(CALL, OP_CALL, 1, number(1))["Error"] == 2
    assert peer.ask(CALL, 140, 1, arguments())["Error"] == 9
    print("ok")


main()

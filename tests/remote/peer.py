"""A peer that knows nothing but docs/protocol.md: talks to the object of the other side, and answers
calls of its own.

Usage: peer.py PORT
"""

import socket
import struct
import sys

NIL = struct.pack("<I", 0)
CALL, INC_REF, DEC_REF, NO_MORE_REFS, INFO, NUMBER_OF, STATE_DATA = 1, 2, 3, 4, 5, 9, 10
REPLY = 0xFFFFFFFF
OP_CALL, OP_ADD = 129, 132
ROOT, ARGUMENT, STATE, RESULT = 1, 5, 6, 7  # numbers of this peer's objects


def number(value):
    return struct.pack("<Id", 0x300001, value)


def text(value):
    return struct.pack("<I", 2) + value.encode() + b"\0"


def entries(values):
    return struct.pack("<I", len(values)) + b"".join(number(k) + v for k, v in values.items())


def table(values):
    return struct.pack("<I", 4) + b"\0" + entries(values)


def arguments(*values):
    return struct.pack("<I", 10) + entries(dict(enumerate(values, 1)))


def receivers(number_of_object):
    return struct.pack("<II36s", 6, number_of_object, b"")


def senders(number_of_object):
    return struct.pack("<II36s", 7, number_of_object, b"")


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

    def entries(self):
        return {self.value(): self.value() for _ in range(self.take("<I"))}

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
            return self.entries()
        if kind in (6, 7):
            whose = "receiver's" if kind == 6 else "sender's"
            return (whose, self.take("<I"), self.take("36s"))[:2]
        if kind == 10:
            return self.entries()
        raise ValueError(f"type {kind}")


class Packet:
    def __init__(self, header, data):
        _, self.kind, self.symbol, self.target, self.context, _, _, _ = header
        reader = Reader(data)
        assert reader.value() is None
        self.value = reader.value()
        assert reader.data == b""


class Peer:
    def __init__(self, port):
        self.socket = socket.create_connection(("127.0.0.1", port))
        self.context = 0
        self.replies = {}  # that have come ahead of those that are waited for
        self.released = set()  # objects of this peer that the other side has let go of

    def read(self, size):
        data = b""
        while len(data) < size:
            part = self.socket.recv(size - len(data))
            assert part, "the connection has ended"
            data += part
        return data

    def receive(self):
        header = struct.unpack("<8I", self.read(32))
        return Packet(header, self.read(header[0] - 32))

    def send(self, kind, symbol, target, context, second):
        size = 32 + len(NIL) + len(second)
        header = struct.pack("<8I", size, kind, symbol, target, context, 0, 0, 0)
        self.socket.sendall(header + NIL + second)

    def exchange(self, kind, symbol, target, second=NIL):
        """Sends a request, and serves the other side until the reply has come."""
        self.context += 1
        context = self.context
        self.send(kind, symbol, target, context, second)
        while context not in self.replies:
            packet = self.receive()
            if packet.kind == REPLY:
                self.replies[packet.context] = packet
            else:
                self.serve(packet)
        return self.replies.pop(context)

    def ask(self, *request):
        return self.exchange(*request).value

    def serve(self, packet):
        if packet.kind == NO_MORE_REFS:
            assert packet.target not in self.released
            self.released.add(packet.target)
            result = NIL
        else:
            assert (packet.kind, packet.symbol, packet.target) == (CALL, OP_CALL, ROOT)
            result = self.called(packet.value)
        self.send(REPLY, 0, 0, packet.context, result)

    def called(self, given):
        """Gets an object of the other side, and the halves of its address; gives it back."""
        kind, box = given[1]
        assert kind == "sender's"
        reply = self.exchange(NUMBER_OF, int(given[2]), int(given[3]))
        assert (reply.value, reply.target) == (None, box)
        assert self.exchange(NUMBER_OF, 8, 0).target == 0
        return table({-1: receivers(box), -2: senders(RESULT)})


def main():
    peer = Peer(int(sys.argv[1]))
    assert peer.ask(CALL, OP_CALL, 1, arguments(number(5))) == {-1: 5.0}
    kind, made = peer.ask(CALL, OP_ADD, 1, arguments())[-1]
    assert kind == "sender's" and made > 1
    assert peer.ask(CALL, OP_CALL, made, arguments(number(7))) == {-1: 7.0}

    # Objects as arguments: one comes back as the other side's, one comes home.
    assert peer.ask(CALL, OP_CALL, 1, arguments(receivers(made))) == {-1: ("sender's", made)}
    assert peer.ask(CALL, OP_CALL, 1, arguments(senders(ARGUMENT))) == {-1: ("receiver's", ARGUMENT)}

    assert peer.ask(INFO, 0, made, text("query")) == {1: "query"}
    assert peer.ask(STATE_DATA, 0, 0, table({1: senders(STATE)})) is None
    assert peer.ask(STATE_DATA, 0, 0, table({})) is None

    # It was counted twice on its way here; one more, and three less are none.
    assert peer.ask(INC_REF, 0, made) is None
    for _ in range(2):
        assert peer.ask(DEC_REF, 0, made) is None
        assert peer.ask(CALL, OP_CALL, made, arguments(number(7))) == {-1: 7.0}
    assert peer.ask(DEC_REF, 0, made) is None
    assert peer.ask(CALL, OP_CALL, made, arguments())["Error"] == 10

    made = peer.ask(CALL, OP_ADD, 1, arguments())[-1][1]
    assert peer.ask(NO_MORE_REFS, 0, made) is None
    assert peer.ask(CALL, OP_CALL, made, arguments())["Error"] == 10
    assert peer.ask(NO_MORE_REFS, 0, made)["Error"] == 6
    assert peer.ask(99, 0, 0)["Error"] == 5
    assert peer.ask(CALL, OP_CALL, 1, number(1))["Error"] == 2
    assert peer.ask(CALL, 140, 1, arguments())["Error"] == 9

    # The other side calls at any time, and lets go of all that it has been given.
    while not peer.released >= {ARGUMENT, STATE, RESULT}:
        peer.serve(peer.receive())
    assert not peer.replies
    print("ok")


main()

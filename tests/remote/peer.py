"""A peer that knows nothing but docs/protocol.md.

Usage: peer.py objects PORT  talks to the object of the other side, and answers calls of its own
       peer.py client PORT   of the script server: finds MediaHost, and calls it
       peer.py host PORT     of the script server: registers as "Python", and serves until told to quit
       peer.py answer PORT   answers one datagram as a script server does
"""

import os
import select
import socket
import struct
import sys

NIL = struct.pack("<I", 0)
CALL, INC_REF, DEC_REF, NO_MORE_REFS, INFO, NUMBER_OF, STATE_DATA = 1, 2, 3, 4, 5, 9, 10
REPLY = 0xFFFFFFFF
OP_CALL, OP_GET, OP_SET, OP_ADD, OP_CALL_FUNCTION, OP_CALL_MEMBER = 129, 130, 131, 132, 143, 144
ROOT, ARGUMENT, STATE, RESULT = 1, 5, 6, 7  # numbers of this peer's objects


def number(value):
    return struct.pack("<Id", 0x300001, value)


def text(value):
    return struct.pack("<I", 2) + value.encode() + b"\0"


def key(name):
    return text(name) if isinstance(name, str) else number(name)


def entries(values):
    return struct.pack("<I", len(values)) + b"".join(key(k) + v for k, v in values.items())


def table(values):
    return struct.pack("<I", 4) + b"\0" + entries(values)


def arguments(*values, name=None):
    named = {} if name is None else {0: name}
    return struct.pack("<I", 10) + entries({**named, **dict(enumerate(values, 1))})


def results(*values):
    return table({-i: value for i, value in enumerate(values, 1)})


def function(number_of_function):
    return struct.pack("<IQ", 5, number_of_function)


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
        if kind == 5:
            return ("function", self.take("<Q"))
        if kind in (6, 7):
            whose = "receiver's" if kind == 6 else "sender's"
            return (whose, self.take("<I"), self.take("36s"))[:2]
        if kind == 9:
            return self.take(f"{self.take('<I')}s")
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


class Ended(Exception):
    pass


class Peer:
    """One end of a connection, which lets the other side call nothing."""

    def __init__(self, connected):
        self.socket = connected
        self.context = 0
        self.replies = {}  # that have come ahead of those that are waited for
        self.released = set()  # objects of this peer that the other side has let go of
        self.holds_root = True  # of the other side

    def read(self, size):
        data = b""
        while len(data) < size:
            part = self.socket.recv(size - len(data))
            if not part:
                raise Ended
            data += part
        return data

    def receive(self):
        header = struct.unpack("<8I", self.read(32))
        return Packet(header, self.read(header[0] - 32))

    def send(self, kind, symbol, target, context, second):
        size = 32 + len(NIL) + len(second)
        header = struct.pack("<8I", size, kind, symbol, target, context, 0, 0, 0)
        self.socket.sendall(header + NIL + second)

    def request(self, kind, symbol, target, second=NIL):
        self.context += 1
        self.send(kind, symbol, target, self.context, second)
        return self.context

    def exchange(self, *request):
        """Sends a request, and serves the other side until the reply has come."""
        context = self.request(*request)
        while context not in self.replies:
            self.serve()
        return self.replies.pop(context)

    def ask(self, *request):
        return self.exchange(*request).value

    def call(self, target, name, *values):
        """The first result of a member."""
        answer = self.ask(CALL, OP_CALL_MEMBER, target, arguments(*values, name=text(name)))
        assert "Error" not in answer, answer
        return answer.get(-1)

    def serve(self):
        packet = self.receive()
        if packet.kind == REPLY:
            self.replies[packet.context] = packet
            return
        if packet.kind == NO_MORE_REFS:
            assert packet.target not in self.released
            self.released.add(packet.target)
            result = NIL
        else:
            assert (packet.kind, packet.target) == (CALL, ROOT)
            result = self.called(packet.symbol, packet.value)
        self.send(REPLY, 0, 0, packet.context, result)

    def called(self, opcode, given):
        raise ValueError(f"called with {opcode}")

    def release_root(self):
        if self.holds_root:
            self.request(NO_MORE_REFS, 0, 1)
        self.holds_root = False

    def leave(self):
        """Lets go of the other side's application, which is all that was held: it lets go, too, and
        closes the connection."""
        self.release_root()
        try:
            while True:
                self.serve()
        except Ended:
            assert self.released == {ROOT}


class ObjectPeer(Peer):
    def called(self, opcode, given):
        """Gets an object of the other side, and the halves of its address; gives it back."""
        assert opcode == OP_CALL
        kind, box = given[1]
        assert kind == "sender's"
        reply = self.exchange(NUMBER_OF, int(given[2]), int(given[3]))
        assert (reply.value, reply.target) == (None, box)
        assert self.exchange(NUMBER_OF, 8, 0).target == 0
        return results(receivers(box), senders(RESULT))


class HostPeer(Peer):
    """What a host is to its callers and to the script server. Its members are functions, found by
    their names, or called by them."""

    UUID = f"python-{os.getpid()}"
    MEMBERS = ("__Connect", "GetPingInfo", "Twice", "TwiceThere", "Quit")
    is_running = True

    def called(self, opcode, given):
        name = given[0]
        if opcode == OP_GET:
            return results(function(self.MEMBERS.index(name)))
        if opcode == OP_CALL_FUNCTION:
            name = self.MEMBERS[name[1]]
        else:
            assert opcode == OP_CALL_MEMBER
        return results(getattr(self, "call_" + name)(given))

    def call___Connect(self, given):
        name, uuid, process = given[1], given[2], given[3]
        assert name and uuid and process != os.getpid()
        return table({"UUID": text(self.UUID), "Name": text("Python")})

    def call_GetPingInfo(self, given):
        return table({"Title": text("Asked for")})

    def call_Twice(self, given):
        return number(2 * given[1])

    def call_TwiceThere(self, given):
        return number(self.call(1, "Twice", number(given[1])))

    def call_Quit(self, given):
        HostPeer.is_running = False
        return NIL


def connect(port):
    return socket.create_connection(("127.0.0.1", port))


def play_objects(port):
    peer = ObjectPeer(connect(port))
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
        peer.serve()
    assert not peer.replies


def play_client(port):
    server = Peer(connect(port))
    assert server.call(1, "FindHost", text("Nobody")) is None
    found = server.call(1, "FindHost", text("MediaHost"))
    assert found in server.call(1, "GetHostList").values()
    server.leave()

    host = Peer(connect(int(found["Port"])))
    answer = host.call(1, "__Connect", text("peer"), text("some-uuid"), number(os.getpid()))
    assert answer == {"UUID": found["UUID"], "Name": "MediaHost"}, answer
    host.ask(CALL, OP_SET, 1, arguments(text("By hand"), name=text("Title")))
    assert host.ask(CALL, OP_GET, 1, arguments(name=text("Title"))) == {-1: "By hand"}
    kind, clip = host.call(1, "Clip", text("Intro"), number(5))
    assert kind == "sender's"
    assert len(host.call(clip, "GetFrame", number(2))) == 64 * 36
    assert host.ask(NO_MORE_REFS, 0, clip) is None
    host.leave()

    for name, part in (b"", b'"MediaHost"'), (b"MediaHost", b'Title = "Untitled"'):
        with socket.socket(socket.AF_INET, socket.SOCK_DGRAM) as datagrams:
            datagrams.sendto(b"SPP:" + name, ("127.0.0.1", port))
            answer = datagrams.recv(1025)
        assert len(answer) <= 1024 and answer.startswith(b"RSP:{") and answer.endswith(b"}\0")
        assert part in answer and b'Version = "18.0"' in answer, answer


def play_host(port):
    listener = socket.create_server(("127.0.0.1", 0))
    server = HostPeer(connect(port))
    info = {
        "Name": text("Python"),
        "ProcessID": number(os.getpid()),
        "UUID": text(HostPeer.UUID),
        "Port": number(listener.getsockname()[1]),
    }
    assert server.call(1, "AddHost", table(info)) is True
    peers = {server.socket: server}
    while HostPeer.is_running:
        for ready in select.select([listener, *peers], [], [])[0]:
            if ready is listener:
                caller = listener.accept()[0]
                peers[caller] = HostPeer(caller)
                continue
            peer = peers[ready]
            try:
                peer.serve()
            except Ended:
                del peers[ready]
                ready.close()
            else:
                if ROOT in peer.released:
                    peer.release_root()
    assert server.call(1, "RemoveHost", number(os.getpid())) is True
    server.leave()


def play_answer(port):
    with socket.socket(socket.AF_INET, socket.SOCK_DGRAM) as datagrams:
        datagrams.bind(("127.0.0.1", port))
        question, sender = datagrams.recvfrom(1024)
        assert question == b"SPP:Film"
        datagrams.sendto(b'RSP:{ Type = "Film", List = { 1, 2.5, "three" } }\0', sender)


PLAYS = {"objects": play_objects, "client": play_client, "host": play_host, "answer": play_answer}
PLAYS[sys.argv[1]](int(sys.argv[2]))
print("ok")

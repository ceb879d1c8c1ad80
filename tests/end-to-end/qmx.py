"""A client of the daemon's socket, written from docs/wire-protocol.md alone, without zbd's code."""

import contextlib
import datetime
import io
import socket
import struct
import uuid

REQUEST, REPLY = 1, 2


def _counted(content):
    return struct.pack("<I", len(content)) + content


def _container(tag, items):
    content = b"".join(items)
    return struct.pack("<BII", tag, len(content), len(items)) + content


_ENCODERS = (  # in the order asked: a boolean is an integer too
    (bool, lambda value: b"\x02" if value else b"\x01"),
    (int, lambda value: struct.pack("<Bq", 3, value) if value < 2**63 else struct.pack("<BQ", 4, value)),
    (float, lambda value: struct.pack("<Bd", 5, value)),
    (datetime.datetime, lambda value: struct.pack("<Bd", 6, value.timestamp())),
    (str, lambda value: b"\x07" + _counted(value.encode())),
    (bytes, lambda value: b"\x08" + _counted(value)),
    (uuid.UUID, lambda value: b"\x09" + value.bytes),
    ((list, tuple), lambda value: _container(10, [encode(item) for item in value])),
    (dict, lambda value: _container(11, [_counted(key.encode()) + encode(value[key]) for key in value])),
)


def encode(value):
    return next(encoder for kind, encoder in _ENCODERS if isinstance(value, kind))(value)


def _take(stream, count):
    data = stream.read(count)
    if len(data) != count:
        raise ConnectionError("cut short")
    return data


def _number(stream, form):
    return struct.unpack("<" + form, _take(stream, struct.calcsize(form)))[0]


def _bytes(stream):
    return _take(stream, _number(stream, "I"))


def _items(stream, read):
    size, count = _number(stream, "I"), _number(stream, "I")
    end = stream.tell() + size
    result = [read() for _ in range(count)]
    assert stream.tell() == end, "wrong size"
    return result


def _dictionary(stream):
    entries = _items(stream, lambda: (_bytes(stream).decode(), _value(stream)))
    assert len(dict(entries)) == len(entries), "a key stands twice"
    return dict(entries)


_DECODERS = {
    1: lambda stream: False, 2: lambda stream: True,
    3: lambda stream: _number(stream, "q"), 4: lambda stream: _number(stream, "Q"),
    5: lambda stream: _number(stream, "d"),
    6: lambda stream: datetime.datetime.fromtimestamp(_number(stream, "d"), datetime.UTC),
    7: lambda stream: _bytes(stream).decode(), 8: _bytes,
    9: lambda stream: uuid.UUID(bytes=_take(stream, 16)),
    10: lambda stream: _items(stream, lambda: _value(stream)), 11: _dictionary,
}


def _value(stream):
    return _DECODERS[_number(stream, "B")](stream)


def decode(data):
    stream = io.BytesIO(data)
    value = _value(stream)
    assert stream.tell() == len(data), "bytes left over"
    return value


def frame(kind, number, body):
    return struct.pack("<IB3xQ", 12 + len(body), kind, number) + body


class Connection(contextlib.ExitStack):
    """Each operation waits up to a minute (TimeoutError). ConnectionError: the daemon has closed."""

    def __init__(self, path):
        super().__init__()
        self._last_id = 0
        with contextlib.ExitStack() as opened:  # closed if the handshake fails
            self.socket = opened.enter_context(socket.socket(socket.AF_UNIX))
            self.socket.connect(path)
            self.socket.settimeout(60)
            self._stream = opened.enter_context(self.socket.makefile("rb"))
            greeting = _take(self._stream, 24)
            assert greeting[:8] == b"qmxs\x01\0\0\0", "foreign greeting"
            self.socket.sendall(b"qmxc\x01\0\0\0" + bytes(byte ^ 0xFF for byte in greeting[8:]))
            self.enter_context(opened.pop_all())

    def request(self, message):
        """Sends a request, while no other one waits, and answers its reply."""
        number = self.send(message)
        answered, reply = self.receive()
        assert answered == number, "a reply to another request"
        return reply

    def send(self, message):
        """Sends a request and answers its id. Who sends many takes in replies meanwhile, or both ends stand still."""
        self._last_id += 1
        self.socket.sendall(frame(REQUEST, self._last_id, encode(message)))
        return self._last_id

    def receive(self):
        """The next reply: its id and content."""
        length, kind, number = struct.unpack("<IB3xQ", _take(self._stream, 16))
        assert kind == REPLY, "no reply"
        return number, decode(_take(self._stream, length - 12))

"""A client of the daemon's socket, written from docs/wire-protocol.md alone; it shares no code with zbd."""

import datetime
import os
import select
import socket
import struct
import uuid

REQUEST, REPLY = 1, 2

_EPOCH = datetime.datetime(1970, 1, 1, tzinfo=datetime.timezone.utc)


def _counted(content):
    return struct.pack("<I", len(content)) + content


def _container(tag, items):
    content = b"".join(items)
    return struct.pack("<BII", tag, len(content), len(items)) + content


_ENCODERS = (  # in the order asked: a boolean is an integer too
    (bool, lambda value: b"\x02" if value else b"\x01"),
    (int, lambda value: struct.pack("<Bq", 3, value) if value < 2**63 else struct.pack("<BQ", 4, value)),
    (float, lambda value: struct.pack("<Bd", 5, value)),
    (datetime.datetime, lambda value: struct.pack("<Bd", 6, (value - _EPOCH).total_seconds())),
    (str, lambda value: b"\x07" + _counted(value.encode())),
    (bytes, lambda value: b"\x08" + _counted(value)),
    (uuid.UUID, lambda value: b"\x09" + value.bytes),
    ((list, tuple), lambda value: _container(10, [encode(item) for item in value])),
    (dict, lambda value: _container(11, [_counted(key.encode()) + encode(value[key]) for key in value])),
)


def encode(value):
    return next(encoder for kind, encoder in _ENCODERS if isinstance(value, kind))(value)


class _Reader:
    def __init__(self, data):
        self._data = data
        self.at = 0
        self._decoders = {
            1: lambda: False, 2: lambda: True,
            3: lambda: self.number("q"), 4: lambda: self.number("Q"), 5: lambda: self.number("d"),
            6: lambda: _EPOCH + datetime.timedelta(seconds=self.number("d")),
            7: self.text, 8: self.counted, 9: lambda: uuid.UUID(bytes=self.take(16)),
            10: lambda: self.items(self.value), 11: self.dictionary,
        }

    def take(self, count):
        self.at += count
        if self.at > len(self._data):
            raise ValueError("value is cut short")
        return self._data[self.at - count:self.at]

    def number(self, form):
        return struct.unpack("<" + form, self.take(struct.calcsize(form)))[0]

    def counted(self):
        return self.take(self.number("I"))

    def text(self):
        return self.counted().decode()

    def items(self, read):
        size, count = self.number("I"), self.number("I")
        end = self.at + size
        result = [read() for _ in range(count)]
        if self.at != end:
            raise ValueError("wrong size")
        return result

    def dictionary(self):
        entries = self.items(lambda: (self.text(), self.value()))
        if len(dict(entries)) != len(entries):
            raise ValueError("key occurs twice")
        return dict(entries)

    def value(self):
        return self._decoders[self.number("B")]()


def decode(data):
    reader = _Reader(data)
    value = reader.value()
    if reader.at != len(data):
        raise ValueError("bytes left over")
    return value


def frame(kind, number, body):
    return struct.pack("<IB3xQ", 12 + len(body), kind, number) + body


def connect_socket(path):
    """A connected socket, however long the path is."""
    connection = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
    directory = os.open(os.path.dirname(path), os.O_PATH | os.O_DIRECTORY)
    try:
        connection.connect(f"/proc/self/fd/{directory}/{os.path.basename(path)}")
    except OSError:
        connection.close()
        raise
    finally:
        os.close(directory)
    return connection


class Connection:
    """Each operation waits up to `timeout` seconds (TimeoutError). ConnectionError: the daemon has closed."""

    def __init__(self, path, timeout=60):
        self.socket = connect_socket(path)
        self.socket.settimeout(timeout)
        self._received = bytearray()
        self._next_id = 1
        self._early = {}  # replies that came while another one was waited for
        try:
            greeting = self._receive(24)
            if greeting[:8] != b"qmxs\x01\0\0\0":
                raise ConnectionError("foreign greeting")
            self.send_bytes(b"qmxc\x01\0\0\0" + bytes(byte ^ 0xFF for byte in greeting[8:]))
        except BaseException:
            self.close()
            raise

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self.close()

    def close(self):
        self.socket.close()

    def request(self, message):
        """Sends a request and answers its reply."""
        number = self.send(message)
        while number not in self._early:
            self._early.update([self.receive()])
        return self._early.pop(number)

    def send(self, message):
        """Sends a request and answers its id, without waiting for the reply."""
        number = self._next_id
        self._next_id += 1
        self.send_bytes(frame(REQUEST, number, encode(message)))
        return number

    def receive(self):
        """The next reply: its id and content."""
        while True:
            length, kind, number = struct.unpack("<IB3xQ", self._receive(16))
            body = self._receive(length - 12)
            if kind == REPLY:
                return number, decode(body)

    def send_bytes(self, data):
        """Takes in what comes meanwhile: the daemon may not read on before it is rid of its replies."""
        view = memoryview(data)
        while view:
            ready = select.select([self.socket], [self.socket], [], self.socket.gettimeout())
            if ready[0]:
                self._take_in()
            elif ready[1]:
                view = view[self.socket.send(view):]
            else:
                raise TimeoutError("the daemon does not read")

    def _take_in(self):
        data = self.socket.recv(1 << 20)
        if not data:
            raise ConnectionError("the daemon closed the connection")
        self._received += data

    def _receive(self, count):
        while len(self._received) < count:
            self._take_in()
        data = bytes(self._received[:count])
        del self._received[:count]
        return data

"""A client of the daemon's socket, written from docs/wire-protocol.md alone. It shares no code with the daemon."""

import datetime
import os
import select
import socket
import struct
import uuid

REQUEST, REPLY, MESSAGE = 1, 2, 3

_EPOCH = datetime.datetime(1970, 1, 1, tzinfo=datetime.timezone.utc)


def _text(value):
    encoded = value.encode()
    return struct.pack("<I", len(encoded)) + encoded


def _container(tag, items):
    content = b"".join(items)
    return struct.pack("<BII", tag, len(content), len(items)) + content


def _integer(value):
    return b"\x03" + struct.pack("<q", value) if value < 2**63 else b"\x04" + struct.pack("<Q", value)


_ENCODERS = (  # in the order asked: a boolean is an integer too
    (bool, lambda value: b"\x02" if value else b"\x01"),
    (int, _integer),
    (float, lambda value: b"\x05" + struct.pack("<d", value)),
    (datetime.datetime, lambda value: b"\x06" + struct.pack("<d", (value - _EPOCH).total_seconds())),
    (str, lambda value: b"\x07" + _text(value)),
    (bytes, lambda value: b"\x08" + struct.pack("<I", len(value)) + value),
    (uuid.UUID, lambda value: b"\x09" + value.bytes),
    (list, lambda value: _container(10, [encode(item) for item in value])),
    (dict, lambda value: _container(11, [_text(key) + encode(item) for key, item in value.items()])),
)


def encode(value):
    return next(encoder for kind, encoder in _ENCODERS if isinstance(value, kind))(value)


class _Reader:
    def __init__(self, data):
        self._data = data
        self._at = 0
        self._decoders = {
            1: lambda: False,
            2: lambda: True,
            3: lambda: self.number("q"),
            4: lambda: self.number("Q"),
            5: lambda: self.number("d"),
            6: lambda: _EPOCH + datetime.timedelta(seconds=self.number("d")),
            7: self.text,
            8: lambda: bytes(self.take(self.number("I"))),
            9: lambda: uuid.UUID(bytes=bytes(self.take(16))),
            10: lambda: self.items(self.value),
            11: lambda: self.dictionary(self.items(lambda: (self.text(), self.value()))),
        }

    def take(self, count):
        if count > len(self._data) - self._at:
            raise ValueError("value is cut short")
        self._at += count
        return self._data[self._at - count:self._at]

    def number(self, form):
        return struct.unpack("<" + form, self.take(struct.calcsize(form)))[0]

    def text(self):
        return bytes(self.take(self.number("I"))).decode()

    def items(self, read):
        size, count = self.number("I"), self.number("I")
        end = self._at + size
        result = [read() for _ in range(count)]
        if self._at != end:
            raise ValueError("wrong size")
        return result

    def dictionary(self, entries):
        result = dict(entries)
        if len(result) != len(entries):
            raise ValueError("key occurs twice")
        return result

    def value(self):
        return self._decoders[self.number("B")]()

    def is_at_end(self):
        return self._at == len(self._data)


def decode(data):
    reader = _Reader(memoryview(data))
    value = reader.value()
    if not reader.is_at_end():
        raise ValueError("bytes left over")
    return value


def decode_matches(data):
    """What "matches" holds: one form, or a list of them."""
    return decode(data)


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
    """One connection. Every operation waits up to `timeout` seconds (TimeoutError) and raises ConnectionError when
    the daemon has closed."""

    def __init__(self, path, timeout=60):
        self.socket = connect_socket(path)
        self._timeout = timeout
        self._received = bytearray()
        self._next_id = 1
        self._early = {}  # replies that came while another one was waited for
        self.socket.setblocking(False)
        try:
            greeting = self._receive(24)
            if greeting[:8] != b"qmxs\x01\0\0\0":
                raise ConnectionError("foreign greeting")
            self.send_bytes(b"qmxc\x01\0\0\0" + bytes(byte ^ 0xFF for byte in greeting[8:]))
        except BaseException:
            self.socket.close()
            raise

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self.close()

    def close(self):
        self.socket.close()

    def shut_down_sending(self):
        self.socket.shutdown(socket.SHUT_WR)

    def request(self, message):
        """Sends a request and answers its reply."""
        number = self.send(message)
        while number not in self._early:
            answered, reply = self.receive()
            self._early[answered] = reply
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
            (length,) = struct.unpack("<I", self._receive(4))
            kind, number = struct.unpack("<B3xQ", self._receive(12))
            body = self._receive(length - 12)
            if kind == REPLY:
                return number, decode(body)

    def send_bytes(self, data):
        """Sends, and takes in what comes meanwhile: the daemon may not read on before it got rid of its replies."""
        view = memoryview(data)
        while view:
            readable, writable, _ = select.select([self.socket], [self.socket], [], self._timeout)
            if not readable and not writable:
                raise TimeoutError("the daemon does not read")
            if readable:
                self._take_in()
            if writable:
                try:
                    view = view[self.socket.send(view):]
                except BlockingIOError:
                    pass

    def _take_in(self):
        try:
            data = self.socket.recv(1 << 20)
        except BlockingIOError:
            return
        if not data:
            raise ConnectionError("the daemon closed the connection")
        self._received += data

    def _receive(self, count):
        while len(self._received) < count:
            if not select.select([self.socket], [], [], self._timeout)[0]:
                raise TimeoutError("the daemon does not answer")
            self._take_in()
        data = bytes(self._received[:count])
        del self._received[:count]
        return data

"""The other side of the wire, written from docs/wire-format.md alone.

wire_peer.py echo SOCKET       connects, sends each value received back, and prints it as JSON
wire_peer.py document FILE     decodes and encodes the example of the document; fails when they differ
"""
import json
import re
import socket
import sys


def decode_body(tag, read):
    if tag == 0x00:
        if read(1) != b"\0":
            raise ValueError("null with a body")
        return None
    if tag == 0x01:
        return int.from_bytes(read(read(1)[0])[-8:], "big")
    if tag == 0x10:
        return read(int.from_bytes(read(2), "big")).split(b"\0")[0].decode("latin-1")
    if tag == 0x41:
        elements = []
        while (tag := read(1)[0]) != 0x40:
            elements.append(decode_body(tag, read))
        return elements
    if tag == 0x42:
        entries = {}
        while (tag := read(1)[0]) != 0x40:
            if tag != 0x10:
                raise ValueError("a key that is no string")
            key = decode_body(tag, read)
            entries[key] = decode(read)
        return entries
    raise ValueError(f"tag {tag:02x}")


def decode(read):
    return decode_body(read(1)[0], read)


def plain_length(value):
    return next(n for n in (1, 2, 4, 8) if value < 1 << 8 * n)


def odd_length(value):
    """As few bytes as hold the value, or many: what only a receiver must know."""
    return (value.bit_length() + 7) // 8 if value % 2 else 9


def encode(value, length=plain_length):
    if value is None:
        return b"\0\0"
    if isinstance(value, int):
        n = length(value)
        return bytes([0x01, n]) + value.to_bytes(n, "big")
    if isinstance(value, str):
        text = value.encode("latin-1")
        return b"\x10" + len(text).to_bytes(2, "big") + text
    if isinstance(value, list):
        return b"\x41" + b"".join(encode(v, length) for v in value) + b"\x40"
    entries = (encode(k) + encode(v, length) for k, v in value.items())
    return b"\x42" + b"".join(entries) + b"\x40"


def echo(path):
    connection = socket.socket(socket.AF_UNIX)
    connection.connect(path)
    stream = connection.makefile("rb")

    def read(count):
        data = stream.read(count)
        if len(data) != count:
            raise EOFError
        return data

    while stream.peek(1):
        value = decode(read)
        connection.sendall(encode(value, odd_length))
        print(json.dumps(value), flush=True)


def document(path):
    with open(path, encoding="utf-8") as file:
        text = file.read()
    value = json.loads(re.search("```json\n(.*?)```", text, re.S)[1])
    lines = re.search("```wire\n(.*?)```", text, re.S)[1].splitlines()
    wire = bytes.fromhex("".join(re.match("([0-9a-f]{2} )+|$", line + " ")[0] for line in lines))
    assert encode(value) == wire, encode(value).hex(" ")
    remaining = iter(wire)
    decoded = decode(lambda count: bytes(next(remaining) for _ in range(count)))
    assert decoded == value and next(remaining, None) is None, decoded
    assert f"these {len(wire)} bytes" in text, len(wire)
    print(wire.hex(" "))
    print(json.dumps(value))


{"echo": echo, "document": document}[sys.argv[1]](sys.argv[2])

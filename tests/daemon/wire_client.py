"""An independent client of qmd's wire format, written with cbor2 alone.

Usage: wire_client.py SOCKET_PATH. Exits 0 when every check passed; prints
what failed otherwise. The envelope's rules are the C++ tests' business; this
shows only that frames and every wire type written by another implementation
are understood.
"""
import socket
import struct
import sys
import uuid

import cbor2

HEADER = struct.Struct(">IIQ")  # payload length, kind, message id


def read_exactly(sock, size):
    data = b""
    while len(data) < size:
        chunk = sock.recv(size - len(data))
        if not chunk:
            raise EOFError("daemon closed the connection")
        data += chunk
    return data


def round_trip(sock, message_id, message):
    payload = cbor2.dumps(message)
    sock.sendall(HEADER.pack(len(payload), 1, message_id) + payload)
    length, kind, reply_id = HEADER.unpack(read_exactly(sock, HEADER.size))
    return kind, reply_id, cbor2.loads(read_exactly(sock, length))


def main(path):
    sock = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
    sock.settimeout(10)
    sock.connect(path)
    rich = {
        "request": "bulk", "version": 3, "flags": 5,
        "uuids": [cbor2.CBORTag(37, uuid.uuid4().bytes)],
        "date": cbor2.CBORTag(1, 1700000000),
        "packed": cbor2.CBORTag(24, cbor2.dumps([{"a": 1}, "b"])),
        "negative": -5, "real": 1.5, "data": b"\x00\x01", "flag": True, "nothing": None,
    }
    failed = False
    for message_id, message in ((7, {"request": "bulk", "version": 3}), (2**63 + 5, rich)):
        answer = round_trip(sock, message_id, message)
        if answer != (2, message_id, {}):
            print("FAILED: %r answered with %r" % (message, answer))
            failed = True
    return 1 if failed else 0


if __name__ == "__main__":
    sys.exit(main(sys.argv[1]))

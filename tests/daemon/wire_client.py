"""An independent client of qmd's wire format, written with cbor2 alone.

Usage: wire_client.py SOCKET_PATH. Exits 0 when every check passed; prints
what failed otherwise.
"""
import socket
import struct
import sys
import uuid

import cbor2

HEADER = struct.Struct(">IIQ")  # payload length, kind, message id


def frame(kind, message_id, payload):
    return HEADER.pack(len(payload), kind, message_id) + payload


def read_exactly(sock, size):
    data = b""
    while len(data) < size:
        chunk = sock.recv(size - len(data))
        if not chunk:
            raise EOFError("daemon closed the connection")
        data += chunk
    return data


def round_trip(sock, message_id, message):
    sock.sendall(frame(1, message_id, cbor2.dumps(message)))
    length, kind, reply_id = HEADER.unpack(read_exactly(sock, HEADER.size))
    reply = cbor2.loads(read_exactly(sock, length))
    return kind, reply_id, reply


def main(path):
    failures = []

    def check(what, condition):
        if not condition:
            failures.append(what)

    sock = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
    sock.settimeout(10)
    sock.connect(path)

    kind, reply_id, reply = round_trip(sock, 7, {"request": "bulk", "version": 3, "flags": 5})
    check("reply frame kind is 2", kind == 2)
    check("reply carries the request's id", reply_id == 7)
    check("bulk replies with an empty map: %r" % (reply,), reply == {})

    _, _, reply = round_trip(sock, 8, {"request": "bulk", "version": 1})
    check("version 1 is code 7: %r" % (reply,),
          reply == {"errorcode": 7, "error": "unsupported protocol version 1 (current 3)"})

    _, _, reply = round_trip(sock, 2**63 + 5, {"request": "nope", "version": 3})
    check("unknown request is code 4: %r" % (reply,),
          reply == {"errorcode": 4, "error": "unrecognized request"})

    # Values of every wire type are accepted in a request.
    rich = {
        "request": "bulk", "version": 3,
        "uuids": [cbor2.CBORTag(37, uuid.uuid4().bytes)],
        "date": cbor2.CBORTag(1, 1700000000),
        "packed": cbor2.CBORTag(24, cbor2.dumps([{"a": 1}, "b"])),
        "negative": -5, "real": 1.5, "data": b"\x00\x01", "flag": True, "nothing": None,
    }
    _, _, reply = round_trip(sock, 9, rich)
    check("a request with every wire type is served: %r" % (reply,), reply == {})

    # A payload that is not a map is ignored; the connection stays.
    sock.sendall(frame(1, 10, cbor2.dumps([1, 2, 3])))
    _, reply_id, reply = round_trip(sock, 11, {"request": "bulk", "version": 2})
    check("after a non-map payload the next request is answered", reply_id == 11 and reply == {})

    # A tag other than 1, 24, 37 closes the connection.
    sock.sendall(frame(1, 12, cbor2.dumps({"request": cbor2.CBORTag(99, "x"), "version": 3})))
    try:
        data = sock.recv(1)
        check("an unknown tag closes the connection", data == b"")
    except (ConnectionResetError, socket.timeout) as error:
        check("an unknown tag closes the connection (%s)" % error, isinstance(error, ConnectionResetError))

    for failure in failures:
        print("FAILED:", failure)
    return 1 if failures else 0


if __name__ == "__main__":
    sys.exit(main(sys.argv[1]))

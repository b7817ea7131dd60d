#!/usr/bin/env python3
"""A minimal client of tenond, the Tenon plug-in registry daemon.

It speaks the relay protocol directly (docs/protocol.md): one Unix stream
socket per client, frames of a 20-byte header and a CBOR map, one reply
frame per request. Needs python3-cbor2 and nothing else.

As a library:

    from tenon_client import Client
    with Client() as tenond:                  # $TENON_ROOT/run/tenon/relay/com.ostrel.tenon.tenond
        reply = tenond.request({"request": "match", "version": 3, "rules": {}, "flags": 0})
        forms = decode_typed(reply["matches"]) if "matches" in reply else None

As a tool (prints the reply as JSON; a daemon error also goes to stderr
and the exit status is 1):

    python3 tenon_client.py '{"request":"match","version":3}' [--service NAME]
"""

import argparse
import base64
import datetime
import json
import os
import socket
import struct
import sys
import uuid

try:
    import cbor2
except ImportError:  # reported when the client is used, with what to install
    cbor2 = None

CBOR2_MISSING = ("the Python module cbor2 is not installed: install the package python3-cbor2 "
                 "(Debian: apt-get install python3-cbor2) or run: pip install cbor2")

DEFAULT_SERVICE = "com.ostrel.tenon.tenond"

# Frame header: length (u32, bytes after the length field: 16 + body), id
# (u64, non-zero, increasing), replyTo (u64, 0 for a request). Big-endian.
HEADER = struct.Struct(">IQQ")
LENGTH = struct.Struct(">I")
MAX_FRAME_LENGTH = 16 * 1024 * 1024

# Inside a typed encoding (plug-in forms under "matches"), a non-negative
# signed 64-bit integer is wrapped in this private tag; see docs/wire-values.md.
TYPED_INTEGER_TAG = 1414420811
INT64_MAX = 2**63 - 1


class ProtocolError(Exception):
    """The daemon sent something this client cannot accept."""


class MissingCbor2(ImportError):
    """cbor2, the one module this client needs beyond Python's own, is not
    installed. Raised when the client is first used rather than on import,
    so that the command-line tool can say what to install."""

    def __init__(self):
        super().__init__(f"tenon_client needs cbor2; {CBOR2_MISSING}", name="cbor2")


def require_cbor2():
    """Raises MissingCbor2 unless cbor2 can be used."""
    if cbor2 is None:
        raise MissingCbor2()


def service_path(service):
    """The socket of a relay service: $TENON_ROOT/run/tenon/relay/<service>."""
    if not service or service in (".", "..") or "/" in service or "\0" in service:
        raise ValueError(f"invalid service name: {service!r}")
    return os.environ.get("TENON_ROOT", "") + "/run/tenon/relay/" + service


def encode_body(body):
    """The CBOR of a request dictionary. UUIDs become tag 37 and datetimes
    tag 1 (cbor2 does both); keys must be strings."""
    if not isinstance(body, dict) or not all(isinstance(key, str) for key in body):
        raise TypeError("a request is a dictionary with string keys")
    require_cbor2()
    return cbor2.dumps(body, datetime_as_timestamp=True, timezone=datetime.timezone.utc)


def _refuse_unknown_tag(decoder, tag):
    raise ProtocolError(f"unknown tag {tag.tag}")


def decode_body(payload):
    """A frame body: one CBOR map. cbor2 turns tag 37 into uuid.UUID and
    tag 1 into an aware datetime; tags it does not interpret itself are
    refused (tenond sends no others)."""
    require_cbor2()
    body = cbor2.loads(payload, tag_hook=_refuse_unknown_tag)
    if not isinstance(body, dict):
        raise ProtocolError("message body must be a map")
    return body


def _typed_integer(decoder, tag):
    if tag.tag != TYPED_INTEGER_TAG:
        raise ProtocolError(f"unknown tag {tag.tag}")
    if not isinstance(tag.value, int) or isinstance(tag.value, bool) or not 0 <= tag.value <= INT64_MAX:
        raise ProtocolError(f"tag {TYPED_INTEGER_TAG} (signed integer) must enclose an unsigned integer "
                            f"up to {INT64_MAX}")
    return tag.value


def decode_typed(data):
    """The value in a typed encoding (the byte string under "matches")."""
    if not isinstance(data, (bytes, bytearray)):
        raise ProtocolError("typed encoding must be a data value")
    require_cbor2()
    return cbor2.loads(bytes(data), tag_hook=_typed_integer)


class Client:
    """One connection to a relay service. Not thread-safe: one request at a
    time, each answered before the next is sent."""

    def __init__(self, service=DEFAULT_SERVICE, timeout=30.0):
        require_cbor2()
        self.service = service
        self._socket = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        self._socket.settimeout(timeout)
        try:
            self._socket.connect(service_path(service))
        except OSError:
            self._socket.close()
            raise
        self._next_id = 1

    def close(self):
        self._socket.close()

    def __enter__(self):
        return self

    def __exit__(self, *exc):
        self.close()

    def request(self, body):
        """Sends one request dictionary and returns the reply dictionary."""
        request_id = self._send(body)
        while True:
            _, reply_to, reply = self._read_frame()
            if reply_to == request_id:
                return reply
            # Anything else (a request from the service, a reply to an
            # earlier request given up on) is not ours to answer.

    def _send(self, body):
        payload = encode_body(body)
        length = 16 + len(payload)
        if length > MAX_FRAME_LENGTH:
            raise ValueError(f"request of {len(payload)} bytes does not fit in a frame")
        request_id = self._next_id
        self._next_id += 1
        self._socket.sendall(HEADER.pack(length, request_id, 0) + payload)
        return request_id

    def _read_frame(self):
        (length,) = LENGTH.unpack(self._read_exactly(LENGTH.size))
        if not 16 <= length <= MAX_FRAME_LENGTH:
            raise ProtocolError(f"frame length {length} out of range")
        rest = self._read_exactly(length)
        frame_id, reply_to = struct.unpack(">QQ", rest[:16])
        return frame_id, reply_to, decode_body(rest[16:])

    def _read_exactly(self, size):
        chunks = []
        while size > 0:
            chunk = self._socket.recv(size)
            if not chunk:
                raise ConnectionError("tenond closed the connection")
            chunks.append(chunk)
            size -= len(chunk)
        return b"".join(chunks)


VIGIL_SERVICE = "com.ostrel.tenon.vigil"


class PlugInInstance:
    """What a plug-in program started by the supervisor says about itself:
    busy while it works, idle again after. The busy-assertion service knows
    the instance by its process; an assertion ends with declare_idle(),
    close() or the process's exit."""

    def __init__(self, timeout=10.0):
        self._client = Client(VIGIL_SERVICE, timeout)

    @staticmethod
    def host_socket():
        """The socket the host talks to this plug-in on, from
        TENON_PLUGIN_SOCKET; None when the variable names no descriptor."""
        text = os.environ.get("TENON_PLUGIN_SOCKET", "")
        if not text.isdigit():
            return None
        return socket.socket(fileno=int(text))

    def declare_busy(self):
        self._declare("busy")

    def declare_idle(self):
        self._declare("idle")

    def close(self):
        self._client.close()

    def _declare(self, request):
        reply = self._client.request({"request": request})
        if "errorcode" in reply:
            raise ProtocolError(f"vigil refused {request}: {reply.get('error')}")


def to_json(value):
    """JSON for values JSON lacks: UUIDs and dates as text, data as base64."""
    def fallback(item):
        if isinstance(item, uuid.UUID):
            return str(item).upper()
        if isinstance(item, datetime.datetime):
            return item.astimezone(datetime.timezone.utc).isoformat().replace("+00:00", "Z")
        if isinstance(item, (bytes, bytearray)):
            return base64.b64encode(item).decode("ascii")
        raise TypeError(f"cannot show {type(item).__name__}")
    return json.dumps(value, indent=2, default=fallback)


def main(argv=None):
    parser = argparse.ArgumentParser(description="Send one request dictionary to tenond.")
    parser.add_argument("request", help='the request as JSON, e.g. \'{"request":"match","version":3}\'')
    parser.add_argument("--service", default=DEFAULT_SERVICE, help="relay service name of tenond")
    parser.add_argument("--timeout", type=float, default=30.0, help="seconds to wait for the reply")
    arguments = parser.parse_args(argv)
    if cbor2 is None:
        print(f"tenon_client: {CBOR2_MISSING}", file=sys.stderr)
        return 1

    try:
        body = json.loads(arguments.request)
        encode_body(body)
    except (json.JSONDecodeError, TypeError) as error:
        print(f"tenon_client: invalid request: {error}", file=sys.stderr)
        return 1
    try:
        with Client(arguments.service, arguments.timeout) as tenond:
            reply = tenond.request(body)
        if isinstance(reply.get("matches"), (bytes, bytearray)):
            reply["matches"] = decode_typed(reply["matches"])
    except (OSError, ValueError) as error:
        print(f"tenon_client: cannot reach tenond at {arguments.service}: {error}", file=sys.stderr)
        return 1
    except (ProtocolError, cbor2.CBORDecodeError) as error:
        print(f"tenon_client: tenond broke the protocol: {error}", file=sys.stderr)
        return 1

    print(to_json(reply))
    if reply.get("errorcode"):
        print(f"tenon_client: error {reply['errorcode']}: {reply.get('error', 'unknown error')}", file=sys.stderr)
        return 1
    return 0


if __name__ == "__main__":
    sys.exit(main())

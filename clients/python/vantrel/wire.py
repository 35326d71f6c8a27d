"""Framing and CBOR bodies (docs/protocol.md, "Frames" and "Body").

Bodies are CBOR maps with text keys. Python values map as: dict <-> map,
list/tuple -> array (decoded as list), str, int (-2**63 .. 2**64-1), float
(written as a double), bool, None, bytes, uuid.UUID <-> tag 37 and
datetime.datetime <-> tag 1 (written as a double, a naive datetime read as
local time; decoded in UTC).
"""

from __future__ import annotations

import datetime
import io
import os
import struct
import uuid
from dataclasses import dataclass
from typing import Any, Dict, List, Mapping, Optional, Tuple

import cbor2

from .protocol import (
    DEFAULT_SERVICE_NAME,
    FRAME_VERSION,
    HEADER_SIZE,
    LENGTH_OVERHEAD,
    MAX_FRAME_LENGTH,
    MAX_NESTING,
    FrameKind,
)

# length, version, kind, reserved, id, in-reply-to; big-endian.
_HEADER = struct.Struct(">IBBHQQ")
assert _HEADER.size == HEADER_SIZE

_TAG_DATE = 1
_TAG_UUID = 37
_INT_MIN = -(2**63)
_INT_MAX = 2**64 - 1


class FramingError(ValueError):
    """Bytes from the peer that are not a valid frame or body. The connection
    they came on cannot be trusted any more."""


@dataclass(frozen=True)
class Frame:
    kind: int
    id: int
    in_reply_to: int
    body: Dict[str, Any]


def runtime_dir(environ: Optional[Mapping[str, str]] = None, uid: Optional[int] = None) -> str:
    """Where services listen: $VANTREL_RUNTIME_DIR, else /run/vantrel for
    root, else $XDG_RUNTIME_DIR/vantrel, else /tmp/vantrel-<uid>. A variable
    set to the empty string counts as unset."""
    env = os.environ if environ is None else environ
    uid = os.getuid() if uid is None else uid
    if env.get("VANTREL_RUNTIME_DIR"):
        return env["VANTREL_RUNTIME_DIR"]
    if uid == 0:
        return "/run/vantrel"
    if env.get("XDG_RUNTIME_DIR"):
        return os.path.join(env["XDG_RUNTIME_DIR"], "vantrel")
    return f"/tmp/vantrel-{uid}"


def socket_path(service: Optional[str] = None, environ: Optional[Mapping[str, str]] = None,
                uid: Optional[int] = None) -> str:
    """The socket of a service: a name beginning with "/" is the path itself,
    any other lies in the runtime directory. None is the daemon's default."""
    name = DEFAULT_SERVICE_NAME if service is None else service
    if name.startswith("/"):
        return name
    return os.path.join(runtime_dir(environ, uid), name)


def encode_frame(kind: int, ident: int, in_reply_to: int, body: Mapping[str, Any]) -> bytes:
    """One frame; ValueError or TypeError when body cannot be sent."""
    if not isinstance(body, Mapping):
        raise TypeError("a body is a dictionary")
    payload: bytes = cbor2.dumps(_prepare(body, 1))
    length = LENGTH_OVERHEAD + len(payload)
    if length > MAX_FRAME_LENGTH:
        raise ValueError(f"message of {length} bytes exceeds the frame limit of {MAX_FRAME_LENGTH}")
    header: bytes = _HEADER.pack(length, FRAME_VERSION, kind, 0, ident, in_reply_to)
    return header + payload


def parse_header(header: bytes) -> Tuple[int, int, int, int]:
    """(length, kind, id, in_reply_to) of a frame header from the daemon,
    which only ever sends replies."""
    length, version, kind, reserved, ident, in_reply_to = _HEADER.unpack(header)
    if length < LENGTH_OVERHEAD or length > MAX_FRAME_LENGTH:
        raise FramingError(f"frame length {length} out of range")
    if version != FRAME_VERSION:
        raise FramingError(f"frame version {version}")
    if reserved != 0 or ident == 0:
        raise FramingError("bad frame header")
    if kind != FrameKind.REPLY or in_reply_to == 0:
        raise FramingError(f"unexpected frame of kind {kind}")
    return length, kind, ident, in_reply_to


def decode_body(data: bytes) -> Dict[str, Any]:
    """Exactly one CBOR map from data."""
    stream = io.BytesIO(data)
    try:
        value = cbor2.CBORDecoder(stream, tag_hook=_refuse_tag).decode()
    except FramingError:
        raise
    except Exception as error:  # cbor2 reports bad input with several types
        raise FramingError(f"bad body: {error}") from error
    if stream.tell() != len(data):
        raise FramingError("trailing bytes after the body")
    if not isinstance(value, dict):
        raise FramingError("body is not a map")
    _check(value, 1)
    return value


class FrameReader:
    """Splits a byte stream from the daemon into frames."""

    def __init__(self) -> None:
        self._buffer = bytearray()

    def feed(self, data: bytes) -> List[Frame]:
        self._buffer += data
        frames = []
        while len(self._buffer) >= HEADER_SIZE:
            length, kind, ident, in_reply_to = parse_header(bytes(self._buffer[:HEADER_SIZE]))
            end = 4 + length
            if len(self._buffer) < end:
                break
            body = decode_body(bytes(self._buffer[HEADER_SIZE:end]))
            del self._buffer[:end]
            frames.append(Frame(kind, ident, in_reply_to, body))
        return frames


def _prepare(value: Any, depth: int) -> Any:
    """value as cbor2 should write it, refusing what the protocol has no
    form for (cbor2 would otherwise write tags the daemon rejects)."""
    if value is None or isinstance(value, (bool, str, bytes)):
        return value
    if isinstance(value, int):
        if not _INT_MIN <= value <= _INT_MAX:
            raise ValueError(f"integer {value} out of range")
        return int(value)  # IntFlag and IntEnum as plain integers
    if isinstance(value, float):
        return value
    if isinstance(value, uuid.UUID):
        return cbor2.CBORTag(_TAG_UUID, value.bytes)
    if isinstance(value, datetime.datetime):
        return cbor2.CBORTag(_TAG_DATE, float(value.timestamp()))
    if isinstance(value, (Mapping, list, tuple)) and depth > MAX_NESTING:
        raise ValueError(f"nesting deeper than {MAX_NESTING}")
    if isinstance(value, Mapping):
        out = {}
        for key, item in value.items():
            if not isinstance(key, str):
                raise TypeError(f"map key {key!r} is not a string")
            out[key] = _prepare(item, depth + 1)
        return out
    if isinstance(value, (list, tuple)):
        return [_prepare(item, depth + 1) for item in value]
    raise TypeError(f"{type(value).__name__} has no protocol form")


def _refuse_tag(decoder: Any, tag: Any) -> Any:
    raise FramingError(f"unknown tag {tag.tag}")


def _check(value: Any, depth: int) -> None:
    # cbor2 itself decodes tags 1 and 37, and a few others into types the
    # protocol has not got; those are refused here.
    if isinstance(value, (dict, list)) and depth > MAX_NESTING:
        raise FramingError(f"nesting deeper than {MAX_NESTING}")
    if isinstance(value, dict):
        for key, item in value.items():
            if not isinstance(key, str):
                raise FramingError("map key is not a string")
            _check(item, depth + 1)
    elif isinstance(value, list):
        for item in value:
            _check(item, depth + 1)
    elif isinstance(value, int) and not isinstance(value, bool):
        if not _INT_MIN <= value <= _INT_MAX:
            raise FramingError("integer out of range")
    elif not (value is None or isinstance(value, (bool, str, bytes, float, uuid.UUID,
                                                  datetime.datetime))):
        raise FramingError(f"value of type {type(value).__name__} not allowed")

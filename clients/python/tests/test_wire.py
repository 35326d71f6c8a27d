"""Service names, framing and the CBOR mapping, without a daemon."""

from __future__ import annotations

import datetime
import unittest
import uuid

import support  # noqa: F401  (puts the package on the path)
from vantrel.protocol import MAX_NESTING, FrameKind
from vantrel.wire import FrameReader, FramingError, decode_body, encode_frame, socket_path


class SocketPathTest(unittest.TestCase):
    def test_service_names(self) -> None:
        # (service, environment, uid, socket)
        cases: list[tuple[str | None, dict[str, str], int, str]] = [
            (None, {}, 0, "/run/vantrel/com.karvo.vantrel.vantreld"),
            ("svc", {"VANTREL_RUNTIME_DIR": "/r", "XDG_RUNTIME_DIR": "/x"}, 1000, "/r/svc"),
            ("svc", {"VANTREL_RUNTIME_DIR": "", "XDG_RUNTIME_DIR": "/x"}, 1000, "/x/vantrel/svc"),
            ("svc", {"XDG_RUNTIME_DIR": "/x"}, 0, "/run/vantrel/svc"),
            ("svc", {"XDG_RUNTIME_DIR": ""}, 1000, "/tmp/vantrel-1000/svc"),
            ("svc", {}, 1000, "/tmp/vantrel-1000/svc"),
            ("/abs/sock", {"VANTREL_RUNTIME_DIR": "/r"}, 0, "/abs/sock"),
        ]
        for service, env, uid, expected in cases:
            with self.subTest(service=service, env=env, uid=uid):
                self.assertEqual(socket_path(service, env, uid), expected)


class BodyTest(unittest.TestCase):
    def test_values_survive_a_frame_split_anywhere(self) -> None:
        body = {
            "uuid": uuid.UUID("8e83e701-b28a-45b8-a08a-4e1c018f2338"),
            "date": datetime.datetime(2024, 5, 1, 12, 0, 0, 250000, tzinfo=datetime.timezone.utc),
            "ints": [0, 2**64 - 1, -(2**63)],
            "nested": {"list": [1.5, True, False, None, b"\x00\xff", "ü"]},
        }
        deepest: list = [0]
        for _ in range(MAX_NESTING - 2):
            deepest = [deepest]
        body["deepest"] = deepest  # the 64th level, counting the body map
        frame = encode_frame(FrameKind.REPLY, 7, 3, body)
        for cut in range(len(frame) + 1):
            reader = FrameReader()
            frames = reader.feed(frame[:cut]) + reader.feed(frame[cut:] + frame)
            self.assertEqual([(f.id, f.in_reply_to, f.body) for f in frames], [(7, 3, body)] * 2)

    def test_bodies_the_protocol_refuses(self) -> None:
        deep = "a16161" + "81" * MAX_NESTING + "00"  # an array one level too deep
        cases = {
            "trailing bytes": "a000",
            "not a map": "80",
            "unknown tag": "a16161d86300",
            "undefined": "a16161f7",
            "key not text": "a10101",
            "date over text": "a16161c16178",
            "uuid of 3 bytes": "a16161d82543010203",
            "truncated": "a1616182",
            "too deep": deep,
        }
        for name, data in cases.items():
            with self.subTest(name):
                with self.assertRaises(FramingError):
                    decode_body(bytes.fromhex(data))

    def test_values_the_protocol_cannot_carry(self) -> None:
        deep: list = []
        for _ in range(MAX_NESTING - 1):
            deep = [deep]  # with the body map, one level too deep
        cases: dict[str, dict] = {
            "integer too large": {"n": 2**64},
            "integer too small": {"n": -(2**63) - 1},
            "set": {"s": {1}},
            "key not text": {1: 1},
            "too deep": {"d": deep},
        }
        for name, body in cases.items():
            with self.subTest(name):
                with self.assertRaises((TypeError, ValueError)):
                    encode_frame(FrameKind.REQUEST, 1, 0, body)

    def test_frames_the_daemon_never_sends(self) -> None:
        cases = {
            "request kind": encode_frame(FrameKind.REQUEST, 1, 0, {}),
            "reply to nothing": encode_frame(FrameKind.REPLY, 1, 0, {}),
            "id 0": encode_frame(FrameKind.REPLY, 0, 1, {}),
            "length below the header": b"\x00\x00\x00\x13" + bytes(20),
            "length above 16 MiB": b"\x01\x00\x00\x01" + bytes(20),
            "version 2": encode_frame(FrameKind.REPLY, 1, 1, {})[:4] + b"\x02" +
                         encode_frame(FrameKind.REPLY, 1, 1, {})[5:],
        }
        for name, frame in cases.items():
            with self.subTest(name):
                with self.assertRaises(FramingError):
                    FrameReader().feed(frame)


if __name__ == "__main__":
    unittest.main()

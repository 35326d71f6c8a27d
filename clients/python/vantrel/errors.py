"""The exceptions of the client: one for the daemon's error replies, one for
a connection that could not be made or has ended."""

from __future__ import annotations

from typing import Any, Dict, Optional, Union

from .protocol import ErrorCode


class VantrelError(Exception):
    """An error reply from the daemon.

    code is an ErrorCode when the daemon used a known one, else the plain
    integer; text is the reply's "error"; reply is the whole reply, for keys
    that come with some errors ("conflicts" of a busy hold).
    """

    def __init__(self, code: int, text: str, reply: Optional[Dict[str, Any]] = None) -> None:
        super().__init__(code, text)
        self.code: Union[ErrorCode, int] = _known(code)
        self.text = text
        self.reply: Dict[str, Any] = dict(reply or {})

    def __str__(self) -> str:
        return f"{self.text} (errorcode {int(self.code)})"


class VantrelConnectionError(ConnectionError):
    """The daemon could not be reached at path, or the connection to it ended
    (it exited, or it or this client broke the framing). Every request still
    waiting on that connection fails with it."""

    def __init__(self, path: str, reason: str) -> None:
        super().__init__(f"{path}: {reason}")
        self.path = path
        self.reason = reason


def _known(code: int) -> Union[ErrorCode, int]:
    try:
        return ErrorCode(code)
    except ValueError:
        return code

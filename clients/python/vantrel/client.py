"""The synchronous client: one connection, one request at a time."""

from __future__ import annotations

import select
import socket
import threading
import time
from typing import Any, Dict, NoReturn, Optional

from . import protocol as p
from ._requests import Requests, check_reply, request_body
from .errors import VantrelConnectionError
from .wire import FrameReader, FramingError, encode_frame, socket_path

DEFAULT_TIMEOUT = 10.0
_READ_SIZE = 65536


class Client(Requests[Dict[str, Any]]):
    """A connection to vantreld. Calls block until their reply arrives, the
    timeout passes (TimeoutError; the connection stays usable and the late
    reply is dropped) or the connection ends (VantrelConnectionError, for
    this call and every later one). Meant for one thread; calls from several
    threads are serialised.

        with Client() as client:
            forms = client.match({"QXExtensionPointIdentifier": "com.karvo.share-services"})
    """

    def __init__(self, service: Optional[str] = None, *, timeout: float = DEFAULT_TIMEOUT,
                 version: int = p.CURRENT_VERSION) -> None:
        """Connects to service (a name in the runtime directory, or a socket
        path; None: the daemon's default); VantrelConnectionError on failure."""
        self.path = socket_path(service)
        self.timeout = timeout
        self.version = version
        self._lock = threading.Lock()
        self._reader = FrameReader()
        self._next_id = 1
        self._closed_reason: Optional[str] = None
        self._socket = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        try:
            self._socket.settimeout(timeout)
            self._socket.connect(self.path)
        except OSError as error:
            self._socket.close()
            raise VantrelConnectionError(self.path, _describe(error)) from error
        self._socket.setblocking(False)

    def __enter__(self) -> "Client":
        return self

    def __exit__(self, *exc: object) -> None:
        self.close()

    def close(self) -> None:
        """Ends the connection, and with it every hold it took."""
        self._end("connection closed by the client")

    @property
    def closed(self) -> bool:
        return self._closed_reason is not None

    def request(self, request_type: str, /, *, timeout: Optional[float] = None,
                **keys: Any) -> Dict[str, Any]:
        """Sends any request with keys and returns its reply."""
        with self._lock:
            self._check_open()
            ident = self._next_id
            self._next_id += 1
            frame = encode_frame(p.FrameKind.REQUEST, ident, 0,
                                 request_body(request_type, self.version, keys))
            deadline = time.monotonic() + (self.timeout if timeout is None else timeout)
            self._send(frame, deadline)
            return check_reply(self._await_reply(ident, deadline, request_type))

    def _send(self, frame: bytes, deadline: float) -> None:
        view = memoryview(frame)
        while view:
            self._wait(select.POLLOUT, deadline, "sending")
            try:
                sent = self._socket.send(view)
            except BlockingIOError:
                continue
            except OSError as error:
                self._fail(_describe(error))
            view = view[sent:]

    def _await_reply(self, ident: int, deadline: float, request_type: str) -> Dict[str, Any]:
        while True:
            try:
                data = self._socket.recv(_READ_SIZE)
            except BlockingIOError:
                self._wait(select.POLLIN, deadline, f"the reply to {request_type!r}")
                continue
            except OSError as error:
                self._fail(_describe(error))
            if not data:
                self._fail("connection closed by the daemon")
            try:
                frames = self._reader.feed(data)
            except FramingError as error:
                self._fail(str(error))
            # Replies to requests that timed out earlier arrive here and are
            # dropped.
            for frame in frames:
                if frame.in_reply_to == ident:
                    return frame.body

    def _wait(self, event: int, deadline: float, what: str) -> None:
        remaining = deadline - time.monotonic()
        poller = select.poll()
        poller.register(self._socket, event)
        if remaining <= 0 or not poller.poll(remaining * 1000):
            if event == select.POLLOUT:
                # Part of a frame may have gone out: the stream is lost.
                self._end(f"timed out {what}")
            raise TimeoutError(f"{self.path}: timed out waiting for {what}")

    def _check_open(self) -> None:
        if self._closed_reason is not None:
            raise VantrelConnectionError(self.path, self._closed_reason)

    def _fail(self, reason: str) -> NoReturn:
        self._end(reason)
        raise VantrelConnectionError(self.path, reason)

    def _end(self, reason: str) -> None:
        if self._closed_reason is None:
            self._closed_reason = reason
            self._socket.close()


def _describe(error: OSError) -> str:
    return error.strerror or str(error)

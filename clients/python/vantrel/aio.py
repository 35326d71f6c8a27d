"""The asyncio client: one connection carrying any number of requests at
once, their replies matched to them by in-reply-to."""

from __future__ import annotations

import asyncio
from typing import Any, Awaitable, Dict, Optional

from . import protocol as p
from ._requests import Requests, check_reply, request_body
from .errors import VantrelConnectionError
from .wire import FramingError, decode_body, encode_frame, parse_header, socket_path

DEFAULT_TIMEOUT = 10.0


class AsyncClient(Requests[Awaitable[Dict[str, Any]]]):
    """A connection to vantreld for asyncio. Every request method returns an
    awaitable of the reply; many may be awaited at once. A request fails with
    TimeoutError after its timeout (its late reply is dropped), and every
    request waiting when the connection ends fails with VantrelConnectionError.

        async with await AsyncClient.connect() as client:
            status, forms = await asyncio.gather(client.explain(), client.match())
    """

    def __init__(self, path: str, reader: asyncio.StreamReader, writer: asyncio.StreamWriter,
                 timeout: float, version: int) -> None:
        # Use connect(); this only takes over an open stream.
        self.path = path
        self.timeout = timeout
        self.version = version
        self._reader = reader
        self._writer = writer
        self._next_id = 1
        self._pending: Dict[int, "asyncio.Future[Dict[str, Any]]"] = {}
        self._closed_reason: Optional[str] = None
        self._drain_lock = asyncio.Lock()
        self._read_task = asyncio.get_running_loop().create_task(self._read_replies())

    @classmethod
    async def connect(cls, service: Optional[str] = None, *, timeout: float = DEFAULT_TIMEOUT,
                      version: int = p.CURRENT_VERSION) -> "AsyncClient":
        """Connects to service (a name in the runtime directory, or a socket
        path; None: the daemon's default); VantrelConnectionError on failure."""
        path = socket_path(service)
        try:
            reader, writer = await asyncio.wait_for(asyncio.open_unix_connection(path), timeout)
        except asyncio.TimeoutError as error:
            raise VantrelConnectionError(path, "timed out connecting") from error
        except OSError as error:
            raise VantrelConnectionError(path, error.strerror or str(error)) from error
        return cls(path, reader, writer, timeout, version)

    async def __aenter__(self) -> "AsyncClient":
        return self

    async def __aexit__(self, *exc: object) -> None:
        await self.close()

    @property
    def closed(self) -> bool:
        return self._closed_reason is not None

    @property
    def in_flight(self) -> int:
        """Requests sent and not yet answered."""
        return len(self._pending)

    async def close(self) -> None:
        """Ends the connection, and with it every hold it took."""
        self._end("connection closed by the client")
        self._read_task.cancel()
        try:
            await self._read_task
        except asyncio.CancelledError:
            pass
        try:
            await self._writer.wait_closed()
        except OSError:
            pass

    async def request(self, request_type: str, /, *, timeout: Optional[float] = None,
                      **keys: Any) -> Dict[str, Any]:
        """Sends any request with keys and returns its reply."""
        if self._closed_reason is not None:
            raise VantrelConnectionError(self.path, self._closed_reason)
        ident = self._next_id
        self._next_id += 1
        frame = encode_frame(p.FrameKind.REQUEST, ident, 0,
                             request_body(request_type, self.version, keys))
        future: "asyncio.Future[Dict[str, Any]]" = asyncio.get_running_loop().create_future()
        self._pending[ident] = future
        try:
            self._writer.write(frame)
            async with self._drain_lock:
                await asyncio.wait_for(self._drain(), self.timeout if timeout is None else timeout)
            reply = await asyncio.wait_for(future, self.timeout if timeout is None else timeout)
        except asyncio.TimeoutError:
            raise TimeoutError(f"{self.path}: timed out waiting for the reply to "
                               f"{request_type!r}") from None
        finally:
            self._pending.pop(ident, None)
            if future.done() and not future.cancelled():
                future.exception()  # failed while sending: reported by the drain
        return check_reply(reply)

    async def _drain(self) -> None:
        try:
            await self._writer.drain()
        except OSError as error:
            self._end(error.strerror or str(error))
        if self._closed_reason is not None:
            raise VantrelConnectionError(self.path, self._closed_reason)

    async def _read_replies(self) -> None:
        reason = "connection closed by the daemon"
        try:
            while True:
                header = await self._reader.readexactly(p.HEADER_SIZE)
                length, _, _, in_reply_to = parse_header(header)
                body = decode_body(await self._reader.readexactly(length + 4 - p.HEADER_SIZE))
                future = self._pending.get(in_reply_to)
                # None: the reply to a request that timed out or was cancelled.
                if future is not None and not future.done():
                    future.set_result(body)
        except asyncio.IncompleteReadError:
            pass
        except FramingError as error:
            reason = str(error)
        except OSError as error:
            reason = error.strerror or str(error)
        self._end(reason)

    def _end(self, reason: str) -> None:
        if self._closed_reason is not None:
            return
        self._closed_reason = reason
        self._writer.close()
        for future in self._pending.values():
            if not future.done():
                future.set_exception(VantrelConnectionError(self.path, reason))

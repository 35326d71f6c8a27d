"""The requests, written once for the synchronous and the asyncio client:
each method builds its keys and hands them to the client's request(), whose
result the method returns as it is (a reply, or an awaitable of one)."""

from __future__ import annotations

import os
import uuid
from typing import Any, Dict, Generic, Iterable, List, Mapping, Optional, TypeVar, Union

from . import protocol as p
from .errors import VantrelError

Reply = Dict[str, Any]
PathLike = Union[str, "os.PathLike[str]"]
UuidLike = Union[uuid.UUID, str]
R = TypeVar("R")


def request_body(request_type: str, version: int, keys: Mapping[str, Any]) -> Reply:
    body: Reply = {p.KEY_REQUEST: request_type, p.KEY_VERSION: version}
    body.update(keys)  # a caller may override "version" on purpose
    return body


def check_reply(reply: Reply) -> Reply:
    """reply as the result of its request, or VantrelError when it carries a
    non-zero "errorcode" (sent as a signed 32-bit code sign-extended to 64 bits)."""
    code = reply.get(p.KEY_ERROR_CODE)
    if not isinstance(code, int) or isinstance(code, bool) or code == 0:
        return reply
    if code >= 2**63:
        code -= 2**64
    text = reply.get(p.KEY_ERROR)
    raise VantrelError(code, text if isinstance(text, str) else "", reply)


def _paths(paths: Iterable[PathLike]) -> List[str]:
    if isinstance(paths, (str, bytes)):
        raise TypeError("paths is a list of paths, not one path")
    return [os.fspath(path) for path in paths]


def _uuids(uuids: Iterable[UuidLike]) -> List[uuid.UUID]:
    if isinstance(uuids, (str, uuid.UUID)):
        raise TypeError("uuids is a list of UUIDs, not one UUID")
    return [value if isinstance(value, uuid.UUID) else uuid.UUID(value) for value in uuids]


class Requests(Generic[R]):
    """One method per request. Every method takes timeout (seconds; None: the
    client's default) and raises VantrelError for an error reply."""

    def request(self, request_type: str, /, *, timeout: Optional[float] = None, **keys: Any) -> R:
        raise NotImplementedError

    def add(self, paths: Iterable[PathLike], *, timeout: Optional[float] = None) -> R:
        """Registers plug-in bundles. Reply: {}."""
        return self.request(p.REQUEST_ADD, timeout=timeout, paths=_paths(paths))

    def remove(self, paths: Iterable[PathLike], *, timeout: Optional[float] = None) -> R:
        """Unregisters plug-in bundles. Reply: {}."""
        return self.request(p.REQUEST_REMOVE, timeout=timeout, paths=_paths(paths))

    def bulk(self, flags: int = 0, *, timeout: Optional[float] = None) -> R:
        """Supports no option; reply: {}."""
        return self.request(p.REQUEST_BULK, timeout=timeout, flags=flags)

    def match(self, rules: Optional[Mapping[str, Any]] = None,
              flags: p.DiscoveryFlags = p.DiscoveryFlags.NONE, *,
              timeout: Optional[float] = None) -> R:
        """Discovers plug-ins. Reply: {"matches": [form, ...]}."""
        keys: Reply = {p.KEY_FLAGS: flags}
        if rules is not None:
            keys[p.KEY_RULES] = rules
        return self.request(p.REQUEST_MATCH, timeout=timeout, **keys)

    def ready(self, uuids: Iterable[UuidLike], flags: int = 0, *,
              timeout: Optional[float] = None) -> R:
        """Enables plug-ins for this process. Reply: {}."""
        return self.request(p.REQUEST_READY, timeout=timeout, uuids=_uuids(uuids), flags=flags)

    def access(self, uuids: Iterable[UuidLike], flags: int = 0, *,
               timeout: Optional[float] = None) -> R:
        """Read tokens for plug-in bundles. Reply: {"extensions": [token, ...]}."""
        return self.request(p.REQUEST_ACCESS, timeout=timeout, uuids=_uuids(uuids), flags=flags)

    def annotate(self, uuids: Iterable[UuidLike], annotations: Mapping[str, Any], *,
                 timeout: Optional[float] = None) -> R:
        """Merges annotations ("election", "extension") into each plug-in's
        stored annotation. Reply: {}."""
        return self.request(p.REQUEST_ANNOTATE, timeout=timeout, uuids=_uuids(uuids),
                            annotations=annotations)

    def hold(self, paths: Iterable[PathLike], flags: p.HoldFlags = p.HoldFlags.PLUGIN, *,
             timeout: Optional[float] = None) -> R:
        """Keeps plug-ins out of discovery and use until released or until
        this connection ends. Reply: {"uuids": token}, a single UUID."""
        return self.request(p.REQUEST_LOCK, timeout=timeout, paths=_paths(paths), flags=flags)

    def release(self, token: UuidLike, *, timeout: Optional[float] = None) -> R:
        """Releases the hold of token (an unknown token releases nothing).
        Reply: {}."""
        return self.request(p.REQUEST_LOCK, timeout=timeout, uuids=_uuids([token]))

    def explain(self, uuid: Optional[UuidLike] = None, path: Optional[PathLike] = None,
                identifier: Optional[str] = None, pid: Optional[int] = None,
                hostpath: Optional[PathLike] = None, rules: Optional[Mapping[str, Any]] = None,
                flags: p.DiscoveryFlags = p.DiscoveryFlags.NONE, *,
                timeout: Optional[float] = None) -> R:
        """Why a plug-in (named by at most one of uuid, path, identifier) is
        or is not offered to a host. Reply: {"plugins": [...]}, or without a
        plug-in the daemon's {"status": {...}}."""
        keys: Reply = {}
        if uuid is not None:
            keys[p.KEY_UUID] = _uuids([uuid])[0]
        if path is not None:
            keys[p.KEY_PATH] = os.fspath(path)
        if identifier is not None:
            keys[p.KEY_IDENTIFIER] = identifier
        if pid is not None:
            keys[p.KEY_PID] = pid
        if hostpath is not None:
            keys[p.KEY_HOST_PATH] = os.fspath(hostpath)
        if rules is not None:
            keys[p.KEY_RULES] = rules
        if flags:
            keys[p.KEY_FLAGS] = flags
        return self.request(p.REQUEST_EXPLAIN, timeout=timeout, **keys)

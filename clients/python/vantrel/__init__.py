"""A client for vantreld, the plug-in registry daemon (docs/protocol.md).

Client is synchronous, AsyncClient is for asyncio; both have one method per
request, return replies as dictionaries and raise VantrelError for the
daemon's error replies and VantrelConnectionError when the daemon cannot be
reached or goes away.
"""

from .aio import AsyncClient
from .client import Client
from .errors import VantrelConnectionError, VantrelError
from .protocol import (
    CURRENT_VERSION,
    DEFAULT_SERVICE_NAME,
    DiscoveryFlags,
    ErrorCode,
    HoldFlags,
)
from .wire import socket_path

__all__ = [
    "AsyncClient",
    "Client",
    "CURRENT_VERSION",
    "DEFAULT_SERVICE_NAME",
    "DiscoveryFlags",
    "ErrorCode",
    "HoldFlags",
    "VantrelConnectionError",
    "VantrelError",
    "socket_path",
]

__version__ = "0.1.0"

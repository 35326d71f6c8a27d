"""The names of the vantreld protocol: service, version, request types, keys,
flags and error codes, spelled as docs/protocol.md spells them."""

from __future__ import annotations

import enum

# The service the daemon listens on unless started with -S.
DEFAULT_SERVICE_NAME = "com.karvo.vantrel.vantreld"
# The version every request carries; the oldest one is still served alike.
CURRENT_VERSION = 3
OLDEST_VERSION = 2

# ---- Frames ----

FRAME_VERSION = 1
# Bytes before the body: length, version, kind, reserved, id, in-reply-to.
HEADER_SIZE = 24
# What the length field counts besides the body.
LENGTH_OVERHEAD = 20
# Largest value of the length field (header after it plus body).
MAX_FRAME_LENGTH = 16 * 1024 * 1024
# Nesting of arrays and maps; the body map is level 1.
MAX_NESTING = 64


class FrameKind(enum.IntEnum):
    REQUEST = 1  # expects a reply
    MESSAGE = 2  # expects none
    REPLY = 3


# ---- Request types ("request") ----

REQUEST_ADD = "add"
REQUEST_REMOVE = "remove"
REQUEST_BULK = "bulk"
REQUEST_MATCH = "match"
REQUEST_READY = "ready"
REQUEST_ACCESS = "access"
REQUEST_ANNOTATE = "annotate"
REQUEST_LOCK = "lock"
# Beyond the base requests: why a plug-in is or is not offered, and without
# a plug-in the daemon's status.
REQUEST_EXPLAIN = "explain"

# ---- Envelope and reply keys ----

KEY_REQUEST = "request"
KEY_VERSION = "version"
KEY_ERROR_CODE = "errorcode"
KEY_ERROR = "error"

# ---- Request keys ----

KEY_PATHS = "paths"
KEY_UUIDS = "uuids"
KEY_FLAGS = "flags"
KEY_RULES = "rules"
KEY_ANNOTATIONS = "annotations"

# "explain": the plug-in (at most one of uuid, path, identifier) and the host.
KEY_UUID = "uuid"
KEY_PATH = "path"
KEY_IDENTIFIER = "identifier"
KEY_PID = "pid"
KEY_HOST_PATH = "hostpath"

# ---- Reply keys ----

KEY_MATCHES = "matches"
KEY_EXTENSIONS = "extensions"
KEY_CONFLICTS = "conflicts"
KEY_CONFLICT_BUNDLE_IDENTIFIER = "ExtensionBundleIdentifier"
KEY_OVERRIDER = "overrider"
KEY_OVERRIDING = "overriding"
KEY_STATUS = "status"
KEY_INSTALLED = "installed"
KEY_HOLDS = "holds"
KEY_PLUGINS = "plugins"
KEY_OFFERED = "offered"
KEY_REASON = "reason"
KEY_TEXT = "text"
KEY_STEPS = "steps"
KEY_TOKEN = "token"

# ---- Annotation keys (inside "annotations") ----

ANNOTATION_ELECTION = "election"
ANNOTATION_EXTENSION = "extension"

# Grants privileged discovery and explaining for another host.
MANAGER_ENTITLEMENT = "com.karvo.private.vantrel.manager"
# Posted after every annotation change and every hold taken or released.
ANNOTATION_CHANGE_NOTIFICATION = "com.karvo.vantrel.annotation-change"


class ErrorCode(enum.IntEnum):
    """Values of "errorcode"; never 0, which reads as success."""

    REGISTRY_REFUSED = 2  # the registry refused a bundle
    BAD_REQUEST = 4  # malformed or unserviceable request
    VERSION_MISMATCH = 7  # protocol version not served
    BAD_PATH = 9  # bad or unknown path
    ACCESS_DENIED = 11  # access refused
    INVALID_PLUGIN = 12  # the plug-in's own configuration is invalid
    BUSY = 14  # plug-ins are busy


class DiscoveryFlags(enum.IntFlag):
    """Bits of "flags" for "match" and "explain"."""

    NONE = 0
    # Keep registrations of one identifier that differ in version.
    VERSIONS = 0x1
    # With VERSIONS: keep equal versions too.
    DUPLICATES = 0x4
    # Only plug-ins on the system volume.
    SYSTEM_ONLY = 0x8
    # Skip the location, dedication, hold and authorisation filters; needs
    # the manager entitlement and an unsandboxed process.
    ALL = 0x200


class HoldFlags(enum.IntFlag):
    """"flags" of "lock" taking a hold: what each path names."""

    NONE = 0
    # An application bundle: hold all its plug-ins (refused while one runs).
    APPLICATION = 1
    # A plug-in bundle: hold that plug-in.
    PLUGIN = 2

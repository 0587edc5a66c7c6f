"""The client of bxd, the Bexil plug-in registry daemon, for Python.

A thin layer over the C interface of libbexil (bexil-c(3)), loaded with ctypes: nothing is compiled when it is
installed. A Client is one connection to the daemon; every request blocks the calling thread (other Python threads
go on meanwhile) until the reply comes or the client's time limit runs out, and a failure raises bexil.Error with the
daemon's code and message. One client may be used from several threads.

Values travel as JSON: dictionaries, lists, strings, numbers, booleans and None as themselves. Kinds JSON lacks
are written as text on the way in (uuid.UUID as its canonical text, datetime as ISO 8601, bytes as base64) and,
where the reply says which keys hold them, read back into uuid.UUID, datetime and bytes.

    with bexil.Client() as client:
        for form in client.match({"RZExtensionPointIdentifier": "com.example.greeting"}):
            print(form["identifier"], form["uuid"], form["path"])
"""

import base64
import collections
import ctypes
import datetime
import enum
import json
import os
import socket
import threading
import uuid

__all__ = [
    "Client", "Code", "Error", "Launched", "Matches", "library_version", "ANNOTATION_CHANGE",
    "DISCOVER_ALL_VERSIONS", "DISCOVER_ALL_INSTANCES", "DISCOVER_SYSTEM_ONLY", "DISCOVER_ALL",
    "HOLD_PLUGIN_PATHS", "HOLD_REFUSE_BUSY", "HOLD_TERMINATE",
]

# Flags of Client.match.
DISCOVER_ALL_VERSIONS = 0x1
DISCOVER_ALL_INSTANCES = 0x4
DISCOVER_SYSTEM_ONLY = 0x8
DISCOVER_ALL = 0x200
# Flags of Client.hold.
HOLD_PLUGIN_PATHS = 0x1
HOLD_REFUSE_BUSY = 0x2
HOLD_TERMINATE = 0x4
# Posted by the daemon each time stored annotations or the set of holds change.
ANNOTATION_CHANGE = "com.quorvel.bexil.annotation-change"


class Code(enum.IntEnum):
    """The codes of failed requests (Error.code may also hold one the daemon added later)."""
    REGISTRY_REFUSED = 2
    INVALID_REQUEST = 4  # also: failed inside the daemon, or no reply at all (Error.no_reply)
    BAD_INTERFACE_SPEC = 6
    VERSION_MISMATCH = 7
    BAD_PATH = 9
    NOT_ALLOWED = 11
    INVALID_CONFIGURATION = 12
    PLUGINS_BUSY = 14
    BAD_BULK_ANNOTATION = 18


class Error(Exception):
    """A failed request: .code and .message as the daemon (or the library) gave them; .no_reply is true when bxd
    is not running, went away or did not answer in time; .reply is the daemon's failed reply as a dictionary, or
    None (a busy refusal of a hold lists the busy plug-ins under "conflicts" there)."""

    def __init__(self, code, message, no_reply=False, reply=None):
        super().__init__(f"code {code}: {message}")
        self.code = code
        self.message = message
        self.no_reply = no_reply
        self.reply = reply


Launched = collections.namedtuple("Launched", ["pid", "channel"])
Launched.__doc__ = "A started plug-in: its pid and a connected socket.socket to it, which the caller closes."

_OBSERVER = ctypes.CFUNCTYPE(None, ctypes.c_char_p, ctypes.c_uint64, ctypes.c_void_p)
_OUT = ctypes.POINTER(ctypes.c_void_p)


def _load():
    try:
        lib = ctypes.CDLL("libbexil.so.0")
    except OSError as error:
        raise ImportError(f"bexil needs libbexil.so.0 (the libbexil0 package): {error}") from error
    client, text, strings = ctypes.c_void_p, ctypes.c_char_p, ctypes.POINTER(ctypes.c_char_p)
    size, flags = ctypes.c_size_t, ctypes.c_uint64
    signatures = {
        "bexil_version": ([], text),
        "bexil_error_code": ([ctypes.c_void_p], ctypes.c_int),
        "bexil_error_message": ([ctypes.c_void_p], text),
        "bexil_error_no_reply": ([ctypes.c_void_p], ctypes.c_int),
        "bexil_error_reply": ([ctypes.c_void_p], text),
        "bexil_error_free": ([ctypes.c_void_p], None),
        "bexil_free": ([ctypes.c_void_p], None),
        "bexil_client_new": ([text, _OUT], client),
        "bexil_client_free": ([client], None),
        "bexil_client_service": ([client], text),
        "bexil_client_set_timeout": ([client, ctypes.c_uint32, _OUT], ctypes.c_int),
        "bexil_add": ([client, strings, size, _OUT, _OUT], ctypes.c_int),
        "bexil_remove": ([client, strings, size, _OUT, _OUT], ctypes.c_int),
        "bexil_bulk": ([client, flags, _OUT, _OUT], ctypes.c_int),
        "bexil_ready": ([client, strings, size, _OUT, _OUT], ctypes.c_int),
        "bexil_access": ([client, strings, size, _OUT, _OUT], ctypes.c_int),
        "bexil_match": ([client, text, flags, _OUT, _OUT], ctypes.c_int),
        "bexil_annotate": ([client, strings, size, text, _OUT, _OUT], ctypes.c_int),
        "bexil_bulk_annotate": ([client, text, _OUT, _OUT], ctypes.c_int),
        "bexil_hold": ([client, strings, size, flags, _OUT, _OUT], ctypes.c_int),
        "bexil_release_hold": ([client, text, _OUT, _OUT], ctypes.c_int),
        "bexil_holds": ([client, _OUT, _OUT], ctypes.c_int),
        "bexil_status": ([client, _OUT, _OUT], ctypes.c_int),
        "bexil_launch": ([client, text, ctypes.POINTER(ctypes.c_int64), ctypes.POINTER(ctypes.c_int), _OUT, _OUT],
                         ctypes.c_int),
        "bexil_observe": ([client, text, _OBSERVER, ctypes.c_void_p, ctypes.POINTER(ctypes.c_uint64), _OUT],
                          ctypes.c_int),
        "bexil_stop_observing": ([client, ctypes.c_uint64, _OUT], ctypes.c_int),
    }
    for name, (arguments, result) in signatures.items():
        function = getattr(lib, name)
        function.argtypes = arguments
        function.restype = result
    return lib


_lib = _load()


def library_version():
    """The version of the loaded libbexil, "major.minor.patch"."""
    return _lib.bexil_version().decode()


__version__ = library_version()


def _raise(error):
    """Raises the Error of a C error object, which it frees."""
    try:
        reply = _lib.bexil_error_reply(error)
        raise Error(_lib.bexil_error_code(error), _lib.bexil_error_message(error).decode(errors="replace"),
                    bool(_lib.bexil_error_no_reply(error)), json.loads(reply) if reply is not None else None)
    finally:
        _lib.bexil_error_free(error)


def _encode(value):
    """JSON text for the library: the kinds JSON lacks as text."""
    def fallback(item):
        if isinstance(item, uuid.UUID):
            return str(item)
        if isinstance(item, (datetime.datetime, datetime.date)):
            return item.isoformat()
        if isinstance(item, (bytes, bytearray)):
            return base64.b64encode(item).decode()
        if isinstance(item, os.PathLike):
            return os.fspath(item)
        raise TypeError(f"bexil cannot send a {type(item).__name__}")

    def keys(item):
        # JSON object keys are text; a UUID key (bulk_annotate) becomes its canonical text.
        if isinstance(item, dict):
            return {str(key) if isinstance(key, uuid.UUID) else key: keys(entry) for key, entry in item.items()}
        if isinstance(item, (list, tuple)):
            return [keys(entry) for entry in item]
        return item

    # NaN and infinities are written as JSON does not allow, so that the library refuses them with its own Error.
    return json.dumps(keys(value), default=fallback).encode()


def _strings(items):
    encoded = [os.fsencode(item) if isinstance(item, (str, bytes, os.PathLike)) else str(item).encode()
               for item in items]
    return (ctypes.c_char_p * len(encoded))(*encoded), len(encoded)


def _uuid(text):
    try:
        return uuid.UUID(text)
    except (TypeError, ValueError, AttributeError):
        return text


def _form(form):
    """A plug-in form with its UUIDs, registration time and hash in Python's types."""
    for key in ("uuid", "overrider"):
        if key in form:
            form[key] = _uuid(form[key])
    if isinstance(form.get("lastmodified"), int):
        form["lastmodified"] = datetime.datetime.fromtimestamp(form["lastmodified"], datetime.timezone.utc)
    if isinstance(form.get("hash"), str):
        form["hash"] = base64.b64decode(form["hash"])
    return form


def _hold(hold):
    hold["uuid"] = _uuid(hold.get("uuid"))
    if isinstance(hold.get("created"), str):
        hold["created"] = datetime.datetime.fromisoformat(hold["created"])
    for plugin in hold.get("plugins", []):
        plugin["uuid"] = _uuid(plugin.get("uuid"))
    return hold


class Matches:
    """The plug-in forms of one discovery, as an iterator. The first page is asked for when the discovery is made,
    so its errors are raised there; later pages are asked for as iteration reaches them. The daemon answers a
    discovery in one reply today, so there is one page."""

    def __init__(self, pages):
        self._pages = pages
        self._page = iter(next(pages))

    def __iter__(self):
        return self

    def __next__(self):
        while True:
            try:
                return next(self._page)
            except StopIteration:
                self._page = iter(next(self._pages))  # raises StopIteration after the last page


class Client:
    """One connection to bxd on `service` (its default service when None), with a time limit in seconds for each
    request. Making one does not check that bxd runs. Use it as a context manager, or call close()."""

    def __init__(self, service=None, timeout=None):
        error = ctypes.c_void_p()
        self._handle = _lib.bexil_client_new(service.encode() if service else None, ctypes.byref(error))
        if not self._handle:
            _raise(error)
        self._observers = {}
        self._observers_lock = threading.Lock()
        if timeout is not None:
            self.timeout = timeout

    def close(self):
        """Ends the connection and every observation; once it returns no callback runs."""
        handle, self._handle = getattr(self, "_handle", None), None
        if handle:
            _lib.bexil_client_free(handle)
            self._observers.clear()

    def __enter__(self):
        return self

    def __exit__(self, *exception):
        self.close()

    def __del__(self):
        self.close()

    @property
    def service(self):
        name = _lib.bexil_client_service(self._handle)
        return name.decode() if name is not None else None

    @property
    def timeout(self):
        return self._timeout if hasattr(self, "_timeout") else 30.0

    @timeout.setter
    def timeout(self, seconds):
        self._call(_lib.bexil_client_set_timeout, max(0, min(int(seconds * 1000), 2**32 - 1)), reply=False)
        self._timeout = float(seconds)

    def _call(self, function, *arguments, reply=True):
        """Calls a request of the C interface; returns its reply as a dictionary, or raises its Error."""
        if not self._handle:
            raise Error(Code.INVALID_REQUEST, "the client is closed")
        text, error = ctypes.c_void_p(), ctypes.c_void_p()
        if reply:
            arguments = arguments + (ctypes.byref(text),)
        if function(self._handle, *arguments, ctypes.byref(error)) != 0:
            _raise(error)
        if not text.value:
            return None
        try:
            return json.loads(ctypes.string_at(text.value))
        finally:
            _lib.bexil_free(text)

    # ---- requests ----

    def add(self, paths):
        """Registers the plug-in bundles at `paths` (absolute)."""
        return self._call(_lib.bexil_add, *_strings(paths))

    def remove(self, paths):
        """Unregisters the plug-ins at `paths`; needs the manager entitlement."""
        return self._call(_lib.bexil_remove, *_strings(paths))

    def bulk(self, flags=0):
        """The bulk registration request."""
        return self._call(_lib.bexil_bulk, flags)

    def ready(self, plugins):
        """Makes the plug-ins (UUIDs) ready for this process, to launch them."""
        return self._call(_lib.bexil_ready, *_strings(plugins))

    def access(self, plugins):
        """Read-only access tokens for the plug-ins (UUIDs), one per plug-in in their order."""
        return self._call(_lib.bexil_access, *_strings(plugins)).get("extensions", [])

    def match(self, rules=None, flags=0):
        """Discovers the plug-ins that match `rules` (a dictionary; None matches all): an iterator of their forms
        (dictionaries with "identifier", "uuid", "path", "version", "annotations" ...)."""
        return Matches(self._match_pages({} if rules is None else rules, flags))

    def _match_pages(self, rules, flags):
        # bexil_match pages through bxd inside the library and hands out the whole result in one piece; once the C
        # interface offers a call per page, this yields each page as it comes and callers iterate the same way.
        reply = self._call(_lib.bexil_match, _encode(rules), flags)
        yield [_form(form) for form in reply.get("matches", [])]

    def annotate(self, plugins, annotations):
        """Sets the annotations ({"election": n, "extension": {...}}) of the plug-ins (UUIDs)."""
        return self._call(_lib.bexil_annotate, *_strings(plugins), _encode(annotations))

    def bulk_annotate(self, annotations):
        """Sets the annotations of many plug-ins: a dictionary from UUID to annotations."""
        return self._call(_lib.bexil_bulk_annotate, _encode(annotations))

    def hold(self, paths, flags=0):
        """Holds the plug-ins of the applications at `paths` (or, with HOLD_PLUGIN_PATHS, the plug-ins at them) out
        of use; returns the hold's UUID for release_hold."""
        return _uuid(self._call(_lib.bexil_hold, *_strings(paths), flags).get("uuids"))

    def release_hold(self, hold):
        """Releases a hold this client placed."""
        return self._call(_lib.bexil_release_hold, str(hold).encode())

    def holds(self):
        """The holds in force (dictionaries with "uuid", "pid", "executable", "created", "plugins"); needs the
        manager entitlement."""
        return [_hold(hold) for hold in self._call(_lib.bexil_holds).get("holds", [])]

    def status(self):
        """What bxd is doing now: "uptime", "connections", "served", "cachedRecords", "cacheLimit", "holdCount",
        "registered"."""
        return self._call(_lib.bexil_status)

    def launch(self, plugin):
        """Starts a plug-in that ready() made ready for this process, in its sandbox; returns its pid and a socket
        connected to it."""
        pid, channel = ctypes.c_int64(), ctypes.c_int(-1)
        self._call(_lib.bexil_launch, str(plugin).encode(), ctypes.byref(pid), ctypes.byref(channel))
        return Launched(pid.value, socket.socket(fileno=channel.value) if channel.value >= 0 else None)

    # ---- notifications ----

    def observe(self, name, callback):
        """Calls callback(name, counter) each time `name` (such as ANNOTATION_CHANGE) is posted, until
        stop_observing(token) or close(). It runs on a thread of the library and must make no request of any
        client: hand the news to a thread of your own (a queue.Queue, for example). Returns the token."""
        def trampoline(posted, counter, _):
            callback(posted.decode(errors="replace"), counter)

        function = _OBSERVER(trampoline)
        token = ctypes.c_uint64()
        self._call(_lib.bexil_observe, name.encode(), function, None, ctypes.byref(token), reply=False)
        with self._observers_lock:
            self._observers[token.value] = function  # ctypes must keep it alive while the library may call it
        return token.value

    def stop_observing(self, token):
        """Ends an observation; once it returns its callback is not running and is not called again."""
        self._call(_lib.bexil_stop_observing, token, reply=False)
        with self._observers_lock:
            self._observers.pop(token, None)

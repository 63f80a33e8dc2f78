"""The client side of the Harmonia audio reporting daemon, mxreportingd, for Python.

A client is one connection to the daemon's socket. On it, reporting sessions are
opened, each named by a 64-bit reporter ID, and reports are sent: a dictionary payload
with a 32-bit category and a 16-bit type. A session lives as long as the connection
that opened it::

    import mxreporting

    with mxreporting.Client() as client:
        with client.session(42, service_type="longformaudio",
                            configuration={"HostApplicationDisplayID": "app"}) as session:
            session.send({"rate": 48000}, category="Session_Playback", type="Start")
        client.send({"x": 1}, category=3, type=2)

Every failure raises Error, a malformed or oversized reply included: ReportingDisabled
when the daemon refuses reports because reporting is switched off on the host,
NotConnected when it cannot be reached, not even by connecting again. Bad arguments
may raise ValueError or TypeError before anything is sent. The standard library and python3-msgpack are all it needs.
"""

import grp
import os
import socket
import threading
import time

import msgpack

__all__ = ["Client", "Session", "Error", "ReportingDisabled", "NotConnected",
           "SERVICE_TYPES", "CATEGORIES", "MESSAGE_TYPES"]

# The daemon's vocabulary: service types, the category's subsystem and proper halves,
# and message types, by name.
SERVICE_TYPES = {
    "generic": 0, "assistant": 1, "telephony": 2, "haptics": 3, "alarms": 4, "standalone": 5,
    "soundautoconfig": 6, "longformaudio": 7, "nonlongformaudio": 8, "audiodeviceusage": 9,
    "alerts": 10, "test": 11, "apiusage": 12, "unknown": 65535,
}
_SUBSYSTEMS = {"Toolbox": 0x80000000, "Session": 0x08000000, "DSP": 0x10000000, "HAL": 0x20000000,
               "Routing": 0x40000000}
_CATEGORIES_PROPER = {"Generic": 1, "Record": 2, "Playback": 3, "PlaybackAndRecord": 4, "Setup": 5,
                      "ClientRequest": 6, "RouteChange": 7, "Error": 8, "DriverStats": 9,
                      "Performance": 10, "Volume": 11}
CATEGORIES = dict(_CATEGORIES_PROPER)
CATEGORIES.update({f"{subsystem}_{name}": high | low
                   for subsystem, high in _SUBSYSTEMS.items()
                   for name, low in _CATEGORIES_PROPER.items()})
MESSAGE_TYPES = {"Generic": 0, "Start": 1, "Stop": 2, "Setup": 3, "Error": 4, "IssueDetector": 5,
                 "Unknown": 65535}

DEFAULT_TIMEOUT = 10.0


class Error(Exception):
    """A request the daemon did not take, or could not be asked."""


class ReportingDisabled(Error):
    """The daemon refused a report: reporting is switched off on this host."""


class NotConnected(Error):
    """The daemon cannot be reached, or the connection to it is gone."""


def default_socket_path():
    """The daemon's socket: run/harmonia/reporting.sock under $MXREPORTING_ROOT (default /)."""
    return os.path.join(os.environ.get("MXREPORTING_ROOT", "/"), "run/harmonia/reporting.sock")


def _code(value, names, what, maximum):
    if isinstance(value, str):
        if value not in names:
            raise ValueError(f"unknown {what} {value!r}")
        return names[value]
    if not isinstance(value, int) or isinstance(value, bool) or not 0 <= value <= maximum:
        raise ValueError(f"{what} must be a name or a number from 0 to {maximum}, not {value!r}")
    return value


def _unreachable(path, error):
    """What to fix when the daemon's socket cannot be connected to."""
    if isinstance(error, PermissionError):
        try:
            group = grp.getgrgid(os.stat(path).st_gid).gr_name
        except (OSError, KeyError):
            group = "the socket's group"
        return (f"permission denied on {path}: only its group may connect; "
                f"add this user to group {group} (then log in again)")
    if isinstance(error, (FileNotFoundError, ConnectionRefusedError)):
        return f"cannot connect to {path}: {error.strerror} (is mxreportingd running? is MXREPORTING_ROOT right?)"
    return f"cannot connect to {path}: {error.strerror or error}"


# The largest reply the daemon sends (a status view, every reporter of every client)
# is far below this: anything larger is refused while it is read.
_MAXIMUM_REPLY_BYTES = 16 << 20
_FIRST_RECONNECT = 0.05
_LONGEST_RECONNECT = 5.0


class _Broken(Exception):
    """The connection is gone: the call may be made again on a new one."""


class Client:
    """One connection to the daemon. Safe to use from several threads; a context manager
    that closes the connection on exit. When the connection breaks (the daemon
    restarted), the next call connects again and restores this client's sessions as
    they were (created, typed, configured, started) before it sends anything else, as
    the C library does."""

    def __init__(self, path=None, timeout=DEFAULT_TIMEOUT):
        """Connects to `path` (default: the daemon's socket under $MXREPORTING_ROOT);
        `timeout` bounds each whole call, in seconds. Raises NotConnected."""
        self._path = path or default_socket_path()
        self._timeout = timeout
        self._lock = threading.Lock()
        self._msgid = 0
        self._sessions = {}  # reporter ID -> what restores it, in creation order
        self._socket = None
        self._closed = False
        try:
            self._connect(time.monotonic() + timeout)
        except _Broken as broken:
            raise NotConnected(str(broken)) from broken

    def __enter__(self):
        return self

    def __exit__(self, *exception):
        self.close()

    def close(self):
        """Closes the connection; its sessions end with it."""
        with self._lock:
            self._closed = True
            self._drop()

    def _drop(self):
        if self._socket is not None:
            self._socket.close()
            self._socket = None

    def _connect(self, deadline):
        connection = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        try:
            connection.settimeout(max(0.001, deadline - time.monotonic()))
            connection.connect(self._path)
        except OSError as error:
            connection.close()
            raise _Broken(_unreachable(self._path, error)) from error
        self._socket = connection
        self._unpacker = msgpack.Unpacker(raw=False, timestamp=3, max_buffer_size=_MAXIMUM_REPLY_BYTES)
        self._replies = {}

    def _reconnect(self, deadline):
        """A new connection with this client's sessions restored, retried with a
        growing wait until `deadline`."""
        wait = _FIRST_RECONNECT
        while True:
            try:
                self._connect(deadline)
                for method, params in self._restoration():
                    if method == "startReportingSessionForID:reply:":
                        self._send(method, params)
                    else:
                        self._reply(self._send(method, params), deadline)
                return
            except _Broken as broken:
                self._drop()
                if time.monotonic() + wait > deadline:
                    raise NotConnected(f"could not reconnect to {self._path} in time: {broken}") from broken
                time.sleep(wait)
                wait = min(wait * 2, _LONGEST_RECONNECT)

    def _restoration(self):
        for reporter_id, session in self._sessions.items():
            yield "createReportingSession:reply:", [reporter_id]
            if session["service_type"] is not None:
                yield "setServiceType:reportingSession:reply:", [session["service_type"], reporter_id]
            if session["configuration"]:
                yield "setConfiguration:forReporterID:reply:", [session["configuration"], reporter_id]
            if session["started"]:
                yield "startReportingSessionForID:reply:", [reporter_id]

    def _send(self, method, params):
        self._msgid += 1
        try:
            self._socket.sendall(msgpack.packb([0, self._msgid, method, params], datetime=True))
        except OSError as error:
            raise _Broken(f"lost the connection to {self._path}: {error}") from error
        return self._msgid

    def _reply(self, msgid, deadline):
        # Replies to others (a start's, held until its stop) are read past.
        while msgid not in self._replies:
            remaining = deadline - time.monotonic()
            if remaining <= 0:
                raise Error("no reply from the daemon in time")
            try:
                self._socket.settimeout(remaining)
                data = self._socket.recv(65536)
            except socket.timeout as error:
                raise Error("no reply from the daemon in time") from error
            except OSError as error:
                raise _Broken(f"lost the connection to {self._path}: {error}") from error
            if not data:
                raise _Broken(f"the daemon closed the connection on {self._path}")
            try:
                self._unpacker.feed(data)
                for message in self._unpacker:
                    if not (isinstance(message, list) and len(message) == 4 and message[0] == 1
                            and isinstance(message[1], int)):
                        raise ValueError(f"not a reply: {message!r:.80}")
                    self._replies[message[1]] = (message[2], message[3])
            except (ValueError, TypeError, msgpack.exceptions.ExtraData, msgpack.exceptions.BufferFull,
                    msgpack.exceptions.UnpackException) as error:
                # What follows cannot be trusted: the next call starts a new connection.
                self._drop()
                raise Error(f"a malformed reply from the daemon: {error}") from error
        error, result = self._replies.pop(msgid)
        if error is not None:
            raise Error("the daemon refused the request: " + _describe(error))
        return result

    def _call(self, method, params, wait=True):
        deadline = time.monotonic() + self._timeout
        with self._lock:
            if self._closed:
                raise NotConnected("the client is closed")
            for attempt in range(2):
                try:
                    if self._socket is None:
                        self._reconnect(deadline)
                    msgid = self._send(method, params)
                    return self._reply(msgid, deadline) if wait else None
                except _Broken as broken:
                    self._drop()
                    if attempt == 1 or time.monotonic() >= deadline:
                        raise NotConnected(str(broken)) from broken

    def call(self, method, *params):
        """Any method of the protocol by its full name, waiting for its result."""
        return self._call(method, list(params))

    def create_session(self, reporter_id):
        """Creates the session of `reporter_id` on this connection (replacing one of that ID)."""
        self.call("createReportingSession:reply:", reporter_id)
        self._sessions.pop(reporter_id, None)
        self._sessions[reporter_id] = {"service_type": None, "configuration": {}, "started": False}

    def set_service_type(self, reporter_id, service_type):
        """Sets its service type, by number or name ("longformaudio", "alarms", ...)."""
        code = _code(service_type, SERVICE_TYPES, "service type", 0xFFFF)
        self.call("setServiceType:reportingSession:reply:", code, reporter_id)
        if reporter_id in self._sessions and reporter_id != 0:
            self._sessions[reporter_id]["service_type"] = code

    def set_configuration(self, reporter_id, configuration):
        """Merges `configuration` (a dict) into the session's configuration."""
        self.call("setConfiguration:forReporterID:reply:", dict(configuration), reporter_id)
        if reporter_id in self._sessions and reporter_id != 0:
            self._sessions[reporter_id]["configuration"].update(configuration)

    def start_session(self, reporter_id):
        """Starts a reporting period. The daemon answers a start only at the session's
        stop, so this does not wait for it."""
        self._call("startReportingSessionForID:reply:", [reporter_id], wait=False)
        if reporter_id in self._sessions and reporter_id != 0:
            self._sessions[reporter_id]["started"] = True

    def stop_session(self, reporter_id):
        """Ends the period: the daemon sends the session's summary."""
        self.call("stopReportingSessionForID:reply:", reporter_id)
        if reporter_id in self._sessions:
            self._sessions[reporter_id]["started"] = False

    def destroy_session(self, reporter_id):
        self.call("destroyReportingSession:reply:", reporter_id)
        self._sessions.pop(reporter_id, None)

    def send(self, payload, category, type, reporter_ids=None):
        """Sends one report: `payload` a dict, `category` and `type` numbers or names
        ("Session_Playback", "Start"). Without `reporter_ids` it goes to every started
        session, or alone when none is started. Raises ReportingDisabled when refused."""
        category = _code(category, CATEGORIES, "category", 0xFFFFFFFF)
        type = _code(type, MESSAGE_TYPES, "message type", 0xFFFF)
        ids = None if reporter_ids is None else list(reporter_ids)
        result = self.call("sendMessage:withCategory:andType:forReportingIDs:reply:", dict(payload), category,
                           type, ids)
        if result is None:
            return
        if isinstance(result, dict) and result.get("code") == 1:
            raise ReportingDisabled("reporting is switched off on this host: nothing was sent")
        raise Error(f"a reply of the wrong shape from the daemon: {result!r:.80}")

    def service_type(self, reporter_id):
        """The service type of the session of that ID in any client, 65535 for none."""
        return _expect(self.call("getServiceNameForReporterID:reply:", reporter_id), int)

    def is_valid(self, reporter_id):
        """Whether a session of that ID exists in any client."""
        validity = _expect(self.call("reporterID:valid:", reporter_id), dict)
        return _expect(validity.get("reporterID"), int) != 0

    def reporters(self):
        """The reporter IDs of every session of every client."""
        return _expect(self.call("getAllReporters:"), list)

    def status(self):
        """The daemon's status view: version, clients, stores, exporters."""
        return _expect(self.call("status"), dict)

    def session(self, reporter_id, service_type=None, configuration=None):
        """A session as a context manager: created, typed, configured and started on
        entry, stopped and destroyed on exit."""
        return Session(self, reporter_id, service_type, configuration)


def _expect(value, kind):
    if not isinstance(value, kind) or isinstance(value, bool):
        raise Error(f"a reply of the wrong shape from the daemon: {value!r:.80}")
    return value


def _describe(error):
    return str(error.get("message", error)) if isinstance(error, dict) else repr(error)


class Session:
    """One reporting session of a client (Client.session)."""

    def __init__(self, client, reporter_id, service_type=None, configuration=None):
        self.client = client
        self.reporter_id = reporter_id
        self._service_type = service_type
        self._configuration = configuration

    def __enter__(self):
        self.client.create_session(self.reporter_id)
        try:
            if self._service_type is not None:
                self.client.set_service_type(self.reporter_id, self._service_type)
            if self._configuration:
                self.client.set_configuration(self.reporter_id, self._configuration)
            self.client.start_session(self.reporter_id)
        except BaseException:
            # What could not be set up is not left behind on the daemon.
            try:
                self.client.destroy_session(self.reporter_id)
            except Error:
                pass
            raise
        return self

    def __exit__(self, kind, value, traceback):
        try:
            self.client.stop_session(self.reporter_id)
            self.client.destroy_session(self.reporter_id)
        except Error:
            # The body's own exception is the one to see.
            if kind is None:
                raise

    def send(self, payload, category, type):
        """Sends a report to this session."""
        self.client.send(payload, category, type, [self.reporter_id])

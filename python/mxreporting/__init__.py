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

Every failure raises Error: ReportingDisabled when the daemon refuses reports because
reporting is switched off on the host, NotConnected when it cannot be reached or the
connection is gone. The standard library and python3-msgpack are all it needs.
"""

import grp
import os
import socket
import threading

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


class Client:
    """One connection to the daemon. Safe to use from several threads; a context manager
    that closes the connection on exit."""

    def __init__(self, path=None, timeout=DEFAULT_TIMEOUT):
        """Connects to `path` (default: the daemon's socket under $MXREPORTING_ROOT);
        `timeout` bounds the wait for each reply, in seconds. Raises NotConnected."""
        self._path = path or default_socket_path()
        self._lock = threading.Lock()
        self._msgid = 0
        self._replies = {}
        self._unpacker = msgpack.Unpacker(raw=False, timestamp=3)
        self._socket = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        self._socket.settimeout(timeout)
        try:
            self._socket.connect(self._path)
        except OSError as error:
            self._socket.close()
            raise NotConnected(_unreachable(self._path, error)) from error

    def __enter__(self):
        return self

    def __exit__(self, *exception):
        self.close()

    def close(self):
        """Closes the connection; its sessions end with it."""
        self._socket.close()

    def _send(self, method, params):
        self._msgid += 1
        try:
            self._socket.sendall(msgpack.packb([0, self._msgid, method, params], datetime=True))
        except OSError as error:
            raise NotConnected(f"lost the connection to {self._path}: {error}") from error
        return self._msgid

    def _reply(self, msgid):
        # Replies to others (a start's, held until its stop) are read past.
        while msgid not in self._replies:
            try:
                data = self._socket.recv(65536)
            except socket.timeout as error:
                raise Error("no reply from the daemon in time") from error
            except OSError as error:
                raise NotConnected(f"lost the connection to {self._path}: {error}") from error
            if not data:
                raise NotConnected(f"the daemon closed the connection on {self._path}")
            self._unpacker.feed(data)
            for message in self._unpacker:
                self._replies[message[1]] = (message[2], message[3])
        error, result = self._replies.pop(msgid)
        if error is not None:
            raise Error("the daemon refused the request: " + _describe(error))
        return result

    def call(self, method, *params):
        """Any method of the protocol by its full name, waiting for its result."""
        with self._lock:
            return self._reply(self._send(method, list(params)))

    def _post(self, method, *params):
        with self._lock:
            self._send(method, list(params))

    def create_session(self, reporter_id):
        """Creates the session of `reporter_id` on this connection (replacing one of that ID)."""
        self.call("createReportingSession:reply:", reporter_id)

    def set_service_type(self, reporter_id, service_type):
        """Sets its service type, by number or name ("longformaudio", "alarms", ...)."""
        self.call("setServiceType:reportingSession:reply:",
                  _code(service_type, SERVICE_TYPES, "service type", 0xFFFF), reporter_id)

    def set_configuration(self, reporter_id, configuration):
        """Merges `configuration` (a dict) into the session's configuration."""
        self.call("setConfiguration:forReporterID:reply:", dict(configuration), reporter_id)

    def start_session(self, reporter_id):
        """Starts a reporting period. The daemon answers a start only at the session's
        stop, so this does not wait for it."""
        self._post("startReportingSessionForID:reply:", reporter_id)

    def stop_session(self, reporter_id):
        """Ends the period: the daemon sends the session's summary."""
        self.call("stopReportingSessionForID:reply:", reporter_id)

    def destroy_session(self, reporter_id):
        self.call("destroyReportingSession:reply:", reporter_id)

    def send(self, payload, category, type, reporter_ids=None):
        """Sends one report: `payload` a dict, `category` and `type` numbers or names
        ("Session_Playback", "Start"). Without `reporter_ids` it goes to every started
        session, or alone when none is started. Raises ReportingDisabled when refused."""
        category = _code(category, CATEGORIES, "category", 0xFFFFFFFF)
        type = _code(type, MESSAGE_TYPES, "message type", 0xFFFF)
        ids = None if reporter_ids is None else list(reporter_ids)
        result = self.call("sendMessage:withCategory:andType:forReportingIDs:reply:", dict(payload), category,
                           type, ids)
        if result is not None:
            raise ReportingDisabled("reporting is switched off on this host: nothing was sent")

    def service_type(self, reporter_id):
        """The service type of the session of that ID in any client, 65535 for none."""
        return self.call("getServiceNameForReporterID:reply:", reporter_id)

    def is_valid(self, reporter_id):
        """Whether a session of that ID exists in any client."""
        return self.call("reporterID:valid:", reporter_id)["reporterID"] != 0

    def reporters(self):
        """The reporter IDs of every session of every client."""
        return self.call("getAllReporters:")

    def status(self):
        """The daemon's status view: version, clients, stores, exporters."""
        return self.call("status")

    def session(self, reporter_id, service_type=None, configuration=None):
        """A session as a context manager: created, typed, configured and started on
        entry, stopped and destroyed on exit."""
        return Session(self, reporter_id, service_type, configuration)


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
        if self._service_type is not None:
            self.client.set_service_type(self.reporter_id, self._service_type)
        if self._configuration:
            self.client.set_configuration(self.reporter_id, self._configuration)
        self.client.start_session(self.reporter_id)
        return self

    def __exit__(self, *exception):
        self.client.stop_session(self.reporter_id)
        self.client.destroy_session(self.reporter_id)

    def send(self, payload, category, type):
        """Sends a report to this session."""
        self.client.send(payload, category, type, [self.reporter_id])

"""Reporting telemetry to the telvaned daemon from Python.

    import telvane

    with telvane.Session({"ComponentType": 7, "SessionID": 1},
                         {"_clientName": "com.example.conference", "_serviceName": "calls"}) as session:
        session.send(12, 1, {"codec": "opus", "jitterMs": 12.5})
        session.flush()
        session.upload("/tmp/call.log")

A Session is one reporting session of libtelvane.so (through its C interface,
telvane/telvane.h). Maps cross as JSON, so payloads, shared data and statistics are
anything json.dumps() writes. Failures raise TelvaneError with the library's code,
domain and message.

Threading: a Session may be used from several threads. The blocking calls (start,
flush, upload) let other Python threads run while they wait. Periodic services and the
message callback run on the library's own threads, up to four services at once; they
must not close their session or call the blocking methods, and what they raise is
logged (logger "telvane") and goes no further.
"""

import atexit
import json
import threading
import weakref

from . import _capi
from ._capi import (  # noqa: F401 - the package's public names
    ERROR_CATEGORY_ZERO,
    ERROR_COMPONENT_TYPE_INVALID,
    ERROR_DOMAIN,
    ERROR_INTERNAL,
    ERROR_INVALID_ARGUMENT,
    ERROR_MISSING_PARAMETER,
    ERROR_NO_SESSION,
    ERROR_REFUSED_BY_DAEMON,
    ERROR_SESSION_INFO_MISSING,
    ERROR_TIMED_OUT,
    ERROR_UPLOAD_FAILED,
    INTERFACE_ERROR_DOMAIN,
    TelvaneError,
)

__all__ = ["Session", "TelvaneError", "send_one_message", "new_hierarchy_token", "library_version"]

DEFAULT_TIMEOUT = 30.0

# Sessions still open, closed before the interpreter goes so that no library thread
# calls back into a finished interpreter.
_open_sessions = weakref.WeakSet()


def _milliseconds(timeout):
    if timeout is None or timeout < 0:
        raise ValueError("the timeout must be a number of seconds, 0 or more")
    return min(int(timeout * 1000), 0xFFFFFFFF)


class Session:
    """One reporting session with the daemon.

    `session_info` is a dict with at least "ComponentType" (5...30), `user_info` a dict
    or None. The constructor connects to the daemon ($TELVANED_SOCKET, else the
    installed socket) and raises TelvaneError when it cannot: code 2 or 3 of
    ERROR_DOMAIN for missing or refused session information, ERROR_NO_SESSION of
    INTERFACE_ERROR_DOMAIN when the daemon cannot be reached.

    As a context manager it starts the session on entry (waiting for the daemon's
    configuration) and finishes and closes it on exit."""

    def __init__(self, session_info, user_info=None, *, start_timeout=DEFAULT_TIMEOUT):
        self._lock = threading.Lock()
        self._handle = None
        self.start_timeout = start_timeout
        handle = _capi.call(
            _capi.telvane_session_create,
            _capi.encode_json(session_info, "the session information"),
            _capi.encode_json(user_info, "the user information"),
        )
        self._handle = handle
        _open_sessions.add(self)

    # ---- Life cycle -------------------------------------------------------------

    def __enter__(self):
        self.start(self.start_timeout)
        return self

    def __exit__(self, exc_type, exc, traceback):
        try:
            if self._handle:
                self.finish()
        finally:
            self.close()
        return False

    def __del__(self):
        try:
            self.close()
        except Exception:  # noqa: BLE001 - nothing to report to at collection
            pass

    @property
    def closed(self):
        return self._handle is None

    def close(self):
        """Frees the session: the calls already made still reach the daemon first (for
        at most about a second beyond that, the daemon's answers are awaited). Closing
        twice does nothing."""
        with self._lock:
            handle, self._handle = self._handle, None
        if not handle:
            return
        _open_sessions.discard(self)
        if getattr(_capi.in_callback, "active", False):
            # A library thread may not free the session it serves: hand it over.
            threading.Thread(target=_capi.telvane_session_free, args=(handle,), daemon=False).start()
        else:
            _capi.telvane_session_free(handle)

    def _require(self):
        handle = self._handle
        if not handle:
            raise ValueError("the session is closed")
        return handle

    def start(self, timeout=DEFAULT_TIMEOUT):
        """Asks the daemon to configure the session and waits for its answer. True when
        it answered with a configuration, False when it answered without one; raises
        TelvaneError (ERROR_TIMED_OUT) when no answer came in time."""
        return _capi.call(_capi.telvane_session_start_wait, self._require(), _milliseconds(timeout))

    def fetch_states(self, user_info=None):
        """Asks the daemon for the session's states again with new user information."""
        _capi.call(
            _capi.telvane_session_fetch_states,
            self._require(),
            _capi.encode_json(user_info, "the user information"),
            _capi.STATES_CALLBACK(),  # no completion
            None,
        )

    def finish(self):
        """Tells the daemon that the session is over."""
        _capi.telvane_session_finish(self._require())

    # ---- Events -----------------------------------------------------------------

    def send(self, category, type, payload=None):  # noqa: A002 - the system's name for it
        """Sends an event (flag 0) with a payload dict. True, also when the session's
        filter from the daemon's configuration dropped it; raises TelvaneError for
        category 0 (ERROR_CATEGORY_ZERO) or a payload that is not a dict."""
        return _capi.call(
            _capi.telvane_session_send, self._require(), category, type, _capi.encode_json(payload, "the payload"))

    def send_dictionary(self, message):
        """Sends an event map ("ParametersCategory", "ParametersType", optionally
        "ParametersPayload" and "ParametersFlag": 1 for realtime). False when the
        session's filter dropped it; raises TelvaneError when it is refused."""
        return _capi.call(
            _capi.telvane_session_send_dictionary, self._require(), _capi.encode_json(message, "the event map"))

    def flush(self, timeout=DEFAULT_TIMEOUT):
        """Asks the daemon to send what it holds for the session and waits for its
        answer; raises TelvaneError with the daemon's error (code -1 "Nothing to flush"
        when no event was waiting, e.g. after a realtime event took the batch along) or
        ERROR_TIMED_OUT."""
        _capi.call(_capi.telvane_session_flush_wait, self._require(), _milliseconds(timeout))

    # ---- Shared data --------------------------------------------------------------

    def update_shared_data(self, data=None, **values):
        """Replaces the shared data of the session's hierarchy (the sessions whose
        session information carries the same "HierarchyToken")."""
        merged = dict(data or {})
        merged.update(values)
        _capi.call(
            _capi.telvane_session_update_shared_data_json,
            self._require(),
            _capi.encode_json(merged, "the shared data"),
        )

    def update_shared_data_for_key(self, key, value):
        """Sets one key of the shared data; None removes it."""
        _capi.call(
            _capi.telvane_session_update_shared_data_for_key,
            self._require(),
            key.encode("utf-8"),
            _capi.encode_json(value, "the shared-data value"),
        )

    # ---- Uploads ------------------------------------------------------------------

    @property
    def server_supports_file_upload(self):
        return bool(_capi.telvane_session_server_supports_file_upload(self._require()))

    def upload(self, path, timeout=60.0):
        """Uploads the file and waits for the daemon's answer; the file is removed once
        the server confirmed it. Raises TelvaneError: ERROR_INVALID_ARGUMENT when the
        file cannot be opened, ERROR_UPLOAD_FAILED, ERROR_TIMED_OUT."""
        _capi.call(
            _capi.telvane_session_upload_file_wait,
            self._require(),
            str(path).encode("utf-8"),
            _milliseconds(timeout),
        )

    # ---- The daemon's configuration --------------------------------------------------

    @property
    def enabled_backends(self):
        """The backends the daemon enabled for the session (known once started)."""
        return json.loads(_capi.take_string(_capi.telvane_session_enabled_backends_json(self._require())) or "[]")

    @property
    def connection_error(self):
        """Why the daemon refused the session (a TelvaneError of code
        ERROR_REFUSED_BY_DAEMON), or None while it has not."""
        pointer = _capi.telvane_session_connection_error(self._require())
        return _capi.error_from(pointer) if pointer else None

    def is_whitelisted_event(self, category):
        return bool(_capi.telvane_session_is_whitelisted_event(self._require(), category))

    def is_blacklisted_event(self, category):
        return bool(_capi.telvane_session_is_blacklisted_event(self._require(), category))

    def set_message_callback(self, callback):
        """Calls `callback(text)` with the daemon's reply texts (on a library thread);
        None removes it."""
        if callback is None:
            _capi.telvane_session_set_logging_callback(
                self._require(), _capi.LOGGING_CALLBACK(), None, _capi.DESTROY_CALLBACK())
            return
        key = _capi.register(callback)
        _capi.telvane_session_set_logging_callback(
            self._require(), _capi.logging_trampoline, key, _capi.release_callback)

    # ---- Periodic metrics tasks ----------------------------------------------------------

    def register_periodic_task(self, module, service, *, update=False, report=True):
        """Registers (or replaces) the service of a module number. `service(stats)` is
        called on the library's threads with a fresh dict: on report ticks what it puts
        there, or the dict it returns, is the module's contribution to the realtime
        event of the log timer; on update ticks (with `update`) it is discarded."""
        if not callable(service):
            raise TypeError("the service must be callable")
        key = _capi.register(service)
        registered = _capi.telvane_session_register_periodic_task(
            self._require(), module, update, report, _capi.periodic_trampoline, key, _capi.release_callback)
        if not registered:
            raise TelvaneError(ERROR_INVALID_ARGUMENT, INTERFACE_ERROR_DOMAIN, "the periodic task was refused")

    def unregister_periodic_task(self, module):
        """True when the module had a service."""
        return bool(_capi.telvane_session_unregister_periodic_task(self._require(), module))

    def start_log_timer(self, interval_seconds, reporting_multiplier, category, type):  # noqa: A002
        """Ticks every `interval_seconds`; every `reporting_multiplier`-th tick the
        reporting modules' statistics are merged and sent as an event of the category
        and type."""
        _capi.telvane_session_start_log_timer(self._require(), interval_seconds, reporting_multiplier, category, type)

    def stop_log_timer(self):
        _capi.telvane_session_stop_log_timer(self._require())


def send_one_message(session_info, user_info, category, type, payload=None):  # noqa: A002
    """Sends one event without a session, over a fresh connection."""
    return _capi.call(
        _capi.telvane_send_one_message,
        _capi.encode_json(session_info, "the session information"),
        _capi.encode_json(user_info, "the user information"),
        category,
        type,
        _capi.encode_json(payload, "the payload"),
    )


def new_hierarchy_token(parent=None):
    """A hierarchy token: a new root without a parent, else the parent's child. Put it
    under "HierarchyToken" in the session information of every session of one
    activity; they then share their shared data."""
    text = _capi.take_string(_capi.telvane_new_hierarchy_token(_capi.encode_json(parent, "the parent token")))
    if text is None:
        raise TypeError("the parent token must be a dict made by new_hierarchy_token()")
    return json.loads(text)


def library_version():
    return _capi.telvane_version().decode("utf-8")


def _close_open_sessions():
    for session in list(_open_sessions):
        session.close()


atexit.register(_close_open_sessions)

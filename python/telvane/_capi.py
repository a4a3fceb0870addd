"""The C interface of libtelvane.so (telvane/telvane.h) seen through ctypes.

Loads the library once: the path in $TELVANE_LIBRARY when set, else the installed
library by its soname. Declares the argument and result types of every function the
package uses, and turns the C interface's errors into TelvaneError.

Callbacks: the C functions that the library calls back (periodic services, the
logging callback and the release of their user data) are module-level ctypes function
objects that live as long as the interpreter; what they call is found through the
integer passed as user data in a registry that the release callback empties.
"""

import ctypes
import ctypes.util
import itertools
import json
import os
import threading

SONAME = "libtelvane.so.0"

ERROR_DOMAIN = "TelvaneErrorDomain"
INTERFACE_ERROR_DOMAIN = "TelvaneInterfaceErrorDomain"

# Codes in ERROR_DOMAIN (and code 7, whose domain is the message itself).
ERROR_SESSION_INFO_MISSING = 2
ERROR_COMPONENT_TYPE_INVALID = 3
ERROR_CATEGORY_ZERO = 4
ERROR_MISSING_PARAMETER = 7
ERROR_REFUSED_BY_DAEMON = 8
# Codes in INTERFACE_ERROR_DOMAIN.
ERROR_INVALID_ARGUMENT = 1
ERROR_NO_SESSION = 2
ERROR_TIMED_OUT = 3
ERROR_UPLOAD_FAILED = 4
ERROR_INTERNAL = 5


class TelvaneError(Exception):
    """An error of the telvane client library: a code, a domain and a message.

    `user_info` holds further details (a dict, or None)."""

    def __init__(self, code, domain, message, user_info=None):
        super().__init__(f"{message} ({domain} {code})")
        self.code = code
        self.domain = domain
        self.message = message
        self.user_info = user_info


def _load():
    path = os.environ.get("TELVANE_LIBRARY")
    if path:
        return ctypes.CDLL(path)
    try:
        return ctypes.CDLL(SONAME)
    except OSError:
        found = ctypes.util.find_library("telvane")
        if not found:
            raise
        return ctypes.CDLL(found)


lib = _load()

_c_bool = ctypes.c_bool
_c_char_p = ctypes.c_char_p
_c_void_p = ctypes.c_void_p
_error_out = ctypes.POINTER(ctypes.c_void_p)

STATES_CALLBACK = ctypes.CFUNCTYPE(None, _c_bool, _c_void_p)
LOGGING_CALLBACK = ctypes.CFUNCTYPE(None, _c_char_p, _c_void_p)
PERIODIC_SERVICE = ctypes.CFUNCTYPE(None, _c_void_p, _c_void_p)
DESTROY_CALLBACK = ctypes.CFUNCTYPE(None, _c_void_p)


def _declare(name, restype, *argtypes):
    function = getattr(lib, name)
    function.restype = restype
    function.argtypes = list(argtypes)
    return function


telvane_error_code = _declare("telvane_error_code", ctypes.c_long, _c_void_p)
telvane_error_domain = _declare("telvane_error_domain", _c_char_p, _c_void_p)
telvane_error_message = _declare("telvane_error_message", _c_char_p, _c_void_p)
telvane_error_user_info_json = _declare("telvane_error_user_info_json", _c_char_p, _c_void_p)
telvane_error_free = _declare("telvane_error_free", None, _c_void_p)
telvane_string_free = _declare("telvane_string_free", None, _c_void_p)
telvane_version = _declare("telvane_version", _c_char_p)

telvane_session_create = _declare("telvane_session_create", _c_void_p, _c_char_p, _c_char_p, _error_out)
telvane_session_free = _declare("telvane_session_free", None, _c_void_p)
telvane_session_start_wait = _declare("telvane_session_start_wait", _c_bool, _c_void_p, ctypes.c_uint32, _error_out)
telvane_session_fetch_states = _declare(
    "telvane_session_fetch_states", _c_bool, _c_void_p, _c_char_p, STATES_CALLBACK, _c_void_p, _error_out)
telvane_session_set_logging_callback = _declare(
    "telvane_session_set_logging_callback", None, _c_void_p, LOGGING_CALLBACK, _c_void_p, DESTROY_CALLBACK)
telvane_session_send = _declare(
    "telvane_session_send", _c_bool, _c_void_p, ctypes.c_uint16, ctypes.c_uint16, _c_char_p, _error_out)
telvane_session_send_dictionary = _declare(
    "telvane_session_send_dictionary", _c_bool, _c_void_p, _c_char_p, _error_out)
telvane_session_flush_wait = _declare("telvane_session_flush_wait", _c_bool, _c_void_p, ctypes.c_uint32, _error_out)
telvane_session_finish = _declare("telvane_session_finish", None, _c_void_p)
telvane_session_update_shared_data_json = _declare(
    "telvane_session_update_shared_data_json", _c_bool, _c_void_p, _c_char_p, _error_out)
telvane_session_update_shared_data_for_key = _declare(
    "telvane_session_update_shared_data_for_key", _c_bool, _c_void_p, _c_char_p, _c_char_p, _error_out)
telvane_session_server_supports_file_upload = _declare(
    "telvane_session_server_supports_file_upload", _c_bool, _c_void_p)
telvane_session_upload_file_wait = _declare(
    "telvane_session_upload_file_wait", _c_bool, _c_void_p, _c_char_p, ctypes.c_uint32, _error_out)
telvane_session_is_whitelisted_event = _declare(
    "telvane_session_is_whitelisted_event", _c_bool, _c_void_p, ctypes.c_uint16)
telvane_session_is_blacklisted_event = _declare(
    "telvane_session_is_blacklisted_event", _c_bool, _c_void_p, ctypes.c_uint16)
telvane_session_connection_error = _declare("telvane_session_connection_error", _c_void_p, _c_void_p)
telvane_session_enabled_backends_json = _declare("telvane_session_enabled_backends_json", _c_void_p, _c_void_p)
telvane_session_register_periodic_task = _declare(
    "telvane_session_register_periodic_task", _c_bool, _c_void_p, ctypes.c_uint32, _c_bool, _c_bool,
    PERIODIC_SERVICE, _c_void_p, DESTROY_CALLBACK)
telvane_session_unregister_periodic_task = _declare(
    "telvane_session_unregister_periodic_task", _c_bool, _c_void_p, ctypes.c_uint32)
telvane_session_start_log_timer = _declare(
    "telvane_session_start_log_timer", None, _c_void_p, ctypes.c_uint32, ctypes.c_uint32, ctypes.c_uint16,
    ctypes.c_uint16)
telvane_session_stop_log_timer = _declare("telvane_session_stop_log_timer", None, _c_void_p)
telvane_stats_update_json = _declare("telvane_stats_update_json", _c_bool, _c_void_p, _c_char_p)
telvane_send_one_message = _declare(
    "telvane_send_one_message", _c_bool, _c_char_p, _c_char_p, ctypes.c_uint16, ctypes.c_uint16, _c_char_p,
    _error_out)
telvane_new_hierarchy_token = _declare("telvane_new_hierarchy_token", _c_void_p, _c_char_p)


def encode_json(value, what):
    """JSON text (UTF-8 bytes) for a C argument; None stays None (no value)."""
    if value is None:
        return None
    try:
        return json.dumps(value, allow_nan=False, separators=(",", ":")).encode("utf-8")
    except (TypeError, ValueError) as error:
        raise TypeError(f"{what} cannot be written as JSON: {error}") from None


def take_string(pointer):
    """The text of a string the library returned, which is then freed."""
    if not pointer:
        return None
    try:
        return ctypes.string_at(pointer).decode("utf-8")
    finally:
        telvane_string_free(pointer)


def error_from(pointer):
    """The TelvaneError of a C error, which is then freed."""
    try:
        domain = (telvane_error_domain(pointer) or b"").decode("utf-8", "replace")
        message = (telvane_error_message(pointer) or b"").decode("utf-8", "replace")
        details = telvane_error_user_info_json(pointer)
        user_info = json.loads(details.decode("utf-8")) if details else None
        return TelvaneError(telvane_error_code(pointer), domain, message, user_info)
    finally:
        telvane_error_free(pointer)


def call(function, *arguments):
    """Calls a C function whose last argument is the error out-pointer; raises its
    error, else returns its result."""
    error = ctypes.c_void_p()
    result = function(*arguments, ctypes.byref(error))
    if error.value:
        raise error_from(error.value)
    return result


# ---- Callbacks from the library's threads ---------------------------------------

_registry = {}
_registry_lock = threading.Lock()
_keys = itertools.count(1)
# Set while this thread runs a callback of the library, so that nothing frees a
# session from a callback (see Session.close()).
in_callback = threading.local()


def register(target):
    """Keeps `target` for a callback and returns the user-data key that finds it."""
    with _registry_lock:
        key = next(_keys)
        _registry[key] = target
    return key


def lookup(key):
    with _registry_lock:
        return _registry.get(key)


def forget(key):
    with _registry_lock:
        _registry.pop(key, None)


@DESTROY_CALLBACK
def release_callback(user_data):
    if user_data:
        forget(user_data)


@LOGGING_CALLBACK
def logging_trampoline(text, user_data):
    target = lookup(user_data)
    if target is None:
        return
    in_callback.active = True
    try:
        target(text.decode("utf-8", "replace") if text is not None else "")
    except Exception:  # noqa: BLE001 - nothing may cross back into C
        _report_callback_failure("logging callback")
    finally:
        in_callback.active = False


@PERIODIC_SERVICE
def periodic_trampoline(stats, user_data):
    target = lookup(user_data)
    if target is None:
        return
    in_callback.active = True
    try:
        filled = {}
        returned = target(filled)
        if returned is not None:
            filled.update(returned)
        if filled:
            text = encode_json(filled, "the statistics")
            if not telvane_stats_update_json(stats, text):
                raise ValueError("the library refused the statistics")
    except Exception:  # noqa: BLE001 - nothing may cross back into C
        _report_callback_failure("periodic service")
    finally:
        in_callback.active = False


def _report_callback_failure(what):
    import logging

    logging.getLogger("telvane").exception("telvane: the %s raised", what)

"""The Python package against the real daemon and the development server: events,
shared data, periodic statistics and uploads arrive as sent, and refusals raise
TelvaneError with the library's code, domain and message."""

import threading

import pytest

import telvane
from conftest import wait_until

CLIENT = "com.example.conference"
USER_INFO = {"_clientName": CLIENT, "_serviceName": "calls"}
REPLY_TIMEOUT = 40.0


def session_info(session_id, **extra):
    info = {"ComponentType": 7, "SessionID": session_id, "ClientVersion": 3}
    info.update(extra)
    return info


def is_event(arrival, category, type_):
    return (arrival.get("kind") == "event" and arrival.get("client") == CLIENT
            and arrival.get("category") == category and arrival.get("type") == type_)


def test_events_and_shared_data_arrive(daemon, devserver):
    token = telvane.new_hierarchy_token()
    assert token["level"] == 0 and token["token"]
    info = session_info(101, BatchEvents=True, RequireUserDict=True, HierarchyToken=token, ClientVersion=41)
    with telvane.Session(info, dict(USER_INFO, tier="gold")) as session:
        assert "brindle" in session.enabled_backends
        assert session.is_whitelisted_event(21) and not session.is_blacklisted_event(21)
        session.update_shared_data({"callID": "C-2041"})
        session.update_shared_data_for_key("room", "Blue")
        # Realtime: sent at once (after a batch, it would take the batch along).
        assert session.send_dictionary({"ParametersCategory": 21, "ParametersType": 2, "ParametersFlag": 1,
                                        "ParametersPayload": {"reason": "lost"}})
        assert session.send(21, 1, {"codec": "opus", "jitterMs": 12.5, "device": "Gadget1"})
        session.flush()
        # The daemon's own refusal comes back as the error it gave.
        with pytest.raises(telvane.TelvaneError) as refused:
            session.flush()
        assert (refused.value.code, refused.value.domain, refused.value.message) == (
            -1, telvane.ERROR_DOMAIN, "Nothing to flush")
    assert session.closed

    batched = devserver.wait_for(lambda a: is_event(a, 21, 1))
    assert batched, daemon.log()[-8000:]
    record = batched[0]["record"]
    assert record["codec"] == "opus"
    assert record["jitterMs"] == 12.5
    assert record["device"] == "Gadget1"
    assert record["callID"] == "C-2041"
    assert record["room"] == "Blue"
    assert record["tier"] == "gold"
    assert batched[0]["service"] == "calls"
    assert batched[0]["path"] == "/events"

    realtime = devserver.wait_for(lambda a: is_event(a, 21, 2))
    assert realtime, daemon.log()[-8000:]
    assert realtime[0]["record"]["reason"] == "lost"
    assert realtime[0]["path"] == "/events/realtime"

    # Leaving the block finished the session: the daemon sends its end message.
    ended = devserver.wait_for(lambda a: is_event(a, 0, 1) and a["record"].get("_clientVersion") == 41)
    assert ended, daemon.log()[-8000:]


def test_refusals_raise_the_library_errors(daemon):
    with pytest.raises(telvane.TelvaneError) as refused:
        telvane.Session({"ComponentType": 4}, USER_INFO)
    assert (refused.value.code, refused.value.domain) == (3, "TelvaneErrorDomain")
    assert refused.value.message == "clientType is invalid"

    with pytest.raises(telvane.TelvaneError) as refused:
        telvane.Session(None, USER_INFO)
    assert (refused.value.code, refused.value.domain) == (telvane.ERROR_SESSION_INFO_MISSING, telvane.ERROR_DOMAIN)

    with telvane.Session(session_info(102), USER_INFO) as session:
        with pytest.raises(telvane.TelvaneError) as refused:
            session.send(0, 1, {"codec": "opus"})
        assert (refused.value.code, refused.value.domain) == (telvane.ERROR_CATEGORY_ZERO, telvane.ERROR_DOMAIN)

        with pytest.raises(telvane.TelvaneError) as refused:
            session.send_dictionary({"ParametersType": 1})
        assert refused.value.code == telvane.ERROR_MISSING_PARAMETER
        assert refused.value.domain == refused.value.message == "Missing mandatory parameter 'category'"

        with pytest.raises(telvane.TelvaneError) as refused:
            session.send(21, 1, ["not", "a", "dict"])
        assert (refused.value.code, refused.value.domain) == (telvane.ERROR_INVALID_ARGUMENT,
                                                              telvane.INTERFACE_ERROR_DOMAIN)
        with pytest.raises(TypeError):
            session.send(21, 1, {"raw": b"bytes"})

        with pytest.raises(telvane.TelvaneError) as refused:
            session.upload("/nonexistent/call.log")
        assert refused.value.code == telvane.ERROR_INVALID_ARGUMENT

        with pytest.raises(telvane.TelvaneError) as refused:
            telvane.send_one_message(session_info(103), USER_INFO, 0, 1)
        assert refused.value.code == telvane.ERROR_CATEGORY_ZERO
    with pytest.raises(ValueError):
        session.send(21, 1)


def test_without_a_daemon_no_session_is_made(monkeypatch, tmp_path):
    monkeypatch.setenv("TELVANED_SOCKET", str(tmp_path / "nobody-listens.sock"))
    with pytest.raises(telvane.TelvaneError) as refused:
        telvane.Session(session_info(104), USER_INFO)
    assert (refused.value.code, refused.value.domain) == (telvane.ERROR_NO_SESSION, telvane.INTERFACE_ERROR_DOMAIN)


def test_upload_sends_the_file_and_removes_it(daemon, devserver, tmp_path):
    path = tmp_path / "call 11.log"
    path.write_text("12:00:01 call started on Gadget2\n12:09:40 call ended\n")
    with telvane.Session(session_info(105), USER_INFO) as session:
        assert session.server_supports_file_upload
        session.upload(path)
    assert not path.exists()
    uploads = devserver.wait_for(lambda a: a.get("kind") == "upload" and a.get("filename") == "call 11.log.gz")
    assert uploads, daemon.log()[-8000:]
    assert uploads[0]["sequence"] == "105"
    with open(uploads[0]["savedAs"]) as saved:
        assert saved.read() == "12:00:01 call started on Gadget2\n12:09:40 call ended\n"


def test_periodic_statistics_are_merged_into_one_event(daemon, devserver):
    calls = {1: threading.Event(), 2: threading.Event()}

    def rates(stats):
        stats["samples"] = [1, 2]
        stats["rxKbps"] = 512
        stats["device"] = "Gadget1"
        calls[1].set()

    def battery(stats):
        calls[2].set()
        return {"samples": [3], "charging": True, "device": "Gadget2"}

    def broken(stats):
        raise RuntimeError("a failing module contributes nothing")

    with telvane.Session(session_info(106), USER_INFO) as session:
        session.register_periodic_task(1, rates)
        session.register_periodic_task(2, battery, update=True)
        session.register_periodic_task(3, broken)
        session.start_log_timer(1, 1, 22, 3)
        assert calls[1].wait(REPLY_TIMEOUT) and calls[2].wait(REPLY_TIMEOUT)
        session.stop_log_timer()
        assert session.unregister_periodic_task(1)
        assert not session.unregister_periodic_task(1)
        assert session.unregister_periodic_task(2)
        assert session.unregister_periodic_task(3)

    reports = devserver.wait_for(lambda a: is_event(a, 22, 3))
    assert reports, daemon.log()[-8000:]
    record = reports[0]["record"]
    # Both modules' contributions in one event. (Posts of this client type carry
    # scalar values only, so the merged "samples" list stays out of the record.)
    assert record["rxKbps"] == 512
    assert record["charging"] is True
    assert record["device"] in ("Gadget1", "Gadget2")
    # Released registrations leave nothing behind in the package.
    assert wait_until(lambda: not telvane._capi._registry, REPLY_TIMEOUT)


def test_message_callback_receives_the_daemons_replies(daemon):
    texts = []
    received = threading.Event()

    def remember(text):
        texts.append(text)
        received.set()

    session = telvane.Session(session_info(107), USER_INFO)
    try:
        session.set_message_callback(remember)
        assert session.start()
        assert received.wait(REPLY_TIMEOUT)
        assert any(text.startswith("URL for the session is: ") or text == "URL not available" for text in texts), \
            texts
        session.set_message_callback(None)
        session.finish()
    finally:
        session.close()
    session.close()  # a second close does nothing
    assert wait_until(lambda: not telvane._capi._registry, REPLY_TIMEOUT)


def test_library_version_and_tokens():
    assert telvane.library_version()
    root = telvane.new_hierarchy_token()
    child = telvane.new_hierarchy_token(root)
    assert child == {"token": root["token"], "level": 1}
    with pytest.raises(TypeError):
        telvane.new_hierarchy_token([1])

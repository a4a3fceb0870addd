"""The Python client of telvane_client_cost_bench.

The same client as client_cost_cxx.cpp, through the Python package `telvane`
(python/telvane, ctypes over the C interface of libtelvane.so, found through
$TELVANE_LIBRARY): one session, started; "ready" on standard output; on a line from
standard input it sends its events (a fresh dict payload per event, as a Python
application does), flushes, waits for the flush reply and prints the CPU time and
wall time this process spent from just before the first send to just after that
reply. Interpreter start-up and the import are outside that window. See
client_cost_bench.cpp for the protocol.

    TELVANE_LIBRARY=build/rel/libtelvane.so PYTHONPATH=python python3 bench/client_cost.py events=2000 mode=batched
"""

import resource
import sys
import time

import telvane


def parse_arguments(argv):
    options = {
        "events": 20000,
        "mode": "batched",
        "component-type": 7,
        "session-id": 2000,
        "index": 0,
        "category": 12,
        "type": 3,
        "client-name": "benchclient",
        "service-name": "com.zembra.bench.delivery",
        "timeout": 600,
    }
    for argument in argv:
        key, equals, value = argument.partition("=")
        if not equals or key not in options:
            raise SystemExit(f"usage: client_cost.py events=N mode=batched|realtime [key=value ...] ({argument}?)")
        options[key] = value if isinstance(options[key], str) else int(value)
    if options["mode"] not in ("batched", "realtime") or options["events"] <= 0:
        raise SystemExit("usage: client_cost.py events=N mode=batched|realtime [key=value ...]")
    return options


def cpu_microseconds(who):
    usage = resource.getrusage(who)
    return round(usage.ru_utime * 1e6), round(usage.ru_stime * 1e6)


def one_word(text):
    text = "".join("_" if c in " \t\r\n" else c for c in (text or ""))
    return text or "-"


def main():
    o = parse_arguments(sys.argv[1:])
    session = telvane.Session(
        {
            "ComponentType": o["component-type"],
            "SessionID": o["session-id"],
            "ClientVersion": 1,
            "BatchEvents": True,
            "RequireUserDict": True,
        },
        {"_clientName": o["client-name"], "_serviceName": o["service-name"]},
    )
    configured = session.start(60)
    print(f"ready configured={int(bool(configured))} backends={one_word(','.join(session.enabled_backends))}",
          flush=True)
    if not sys.stdin.readline():
        session.close()
        return 1

    events, index, category, kind = o["events"], o["index"], o["category"], o["type"]
    realtime = o["mode"] == "realtime"
    start_rss_kib = resource.getrusage(resource.RUSAGE_SELF).ru_maxrss
    self_before = cpu_microseconds(resource.RUSAGE_SELF)
    thread_before = cpu_microseconds(resource.RUSAGE_THREAD)
    start = time.monotonic_ns()
    refused = 0
    for sequence in range(events):
        payload = {
            "name": "call.quality",
            "bundle": "com.example.conference",
            "state": "foreground",
            "reason": "periodic",
            "count": 42,
            "bytes": 123456,
            "durationMs": 1500,
            "clientIndex": index,
            "sequence": sequence,
            "ratio": 0.875,
        }
        if realtime:
            sent = session.send_dictionary({"ParametersCategory": category, "ParametersType": kind,
                                            "ParametersFlag": 1, "ParametersPayload": payload})
        else:
            sent = session.send(category, kind, payload)
        if not sent:
            refused += 1
    sent_at = time.monotonic_ns()
    # The flush reply comes after the reply to every event (see client_cost_cxx.cpp).
    flush, flush_text = "ok", "-"
    try:
        session.flush(o["timeout"])
    except telvane.TelvaneError as error:
        timed_out = error.code == telvane.ERROR_TIMED_OUT and error.domain == telvane.INTERFACE_ERROR_DOMAIN
        flush, flush_text = ("timeout" if timed_out else "error"), one_word(error.message)
    done = time.monotonic_ns()
    thread_after = cpu_microseconds(resource.RUSAGE_THREAD)
    self_after = cpu_microseconds(resource.RUSAGE_SELF)
    print(
        f"result events={events} refused={refused} user_us={self_after[0] - self_before[0]} "
        f"sys_us={self_after[1] - self_before[1]} "
        f"caller_us={sum(thread_after) - sum(thread_before)} wall_us={(done - start) // 1000} "
        f"send_wall_us={(sent_at - start) // 1000} flush={flush} flush_text={flush_text} "
        f"start_rss_kib={start_rss_kib} peak_rss_kib={resource.getrusage(resource.RUSAGE_SELF).ru_maxrss}",
        flush=True,
    )
    # The driver closes our standard input when it has read the result.
    while sys.stdin.readline():
        pass
    session.finish()
    session.close()
    return 1 if flush == "timeout" else 0


if __name__ == "__main__":
    sys.exit(main())

"""The debugpy mode of run_bench.py, run in a process of its own by an interpreter that has
debugpy installed (debugpy's threads and its adapter process must not share a process with
the other modes).

Usage: python debugpy_child.py ITERATIONS REPEATS [WORKLOAD,...]
WORKLOAD is a key of run_bench.WORKLOADS (main, exc, gen, thr; default main).
Prints one JSON line: {"times": [seconds, ...] (of main), "times_by_workload": {workload:
[seconds, ...]}, "untraced_times_by_workload": {workload: [seconds, ...]} (the same
workloads in this process before debugpy starts), "tracer": ...} or {"skip": reason}.

The setting is the one a user of an editor has: debugpy listens on the loopback interface,
a client (a second process started from here, speaking the Debug Adapter Protocol) attaches,
sets one breakpoint on a line of the workload's file that is never reached, and finishes the
configuration; the program then runs freely. The times are of run_bench.timed(), as for the
other modes: a warm-up run, then REPEATS timed runs. With BENCH_DAP_TRACE=1 in the
environment the client prints every protocol message it receives to stderr. With
BENCH_CALLGRIND_NULL_TRACER=DIR (count_instructions.py sets it when it runs this script under
callgrind) the timed spans switch callgrind's collection on and off, with the _null_tracer
built in DIR.
"""

import itertools
import json
import os
import socket
import subprocess
import sys

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, HERE)

CLIENT_TIMEOUT = 60  # seconds for the client's handshake


# ---- the client: a second process ------------------------------------------------------------


class Connection:
    """One Debug Adapter Protocol connection: framed JSON messages over a socket."""

    def __init__(self, port):
        self.sock = socket.create_connection(("127.0.0.1", port), timeout=CLIENT_TIMEOUT)
        self.reader = self.sock.makefile("rb")
        self.seq = itertools.count(1)

    def request(self, command, **arguments):
        seq = next(self.seq)
        body = json.dumps({"seq": seq, "type": "request", "command": command,
                           "arguments": arguments}).encode()
        self.sock.sendall(b"Content-Length: %d\r\n\r\n" % len(body) + body)
        return seq

    def receive(self):
        length = None
        while True:
            line = self.reader.readline()
            if not line:
                return None
            line = line.strip()
            if not line:
                break
            name, _, value = line.partition(b":")
            if name.strip().lower() == b"content-length":
                length = int(value)
        return json.loads(self.reader.read(length))

    def wait_for(self, matches):
        while True:
            message = self.receive()
            if message is None:
                raise ConnectionError("the adapter closed the connection")
            if os.environ.get("BENCH_DAP_TRACE"):
                print(message, file=sys.stderr)
            if matches(message):
                return message


def response_to(seq):
    return lambda m: m.get("type") == "response" and m.get("request_seq") == seq


def run_client(port, path, line):
    """Attaches, sets the breakpoint, finishes the configuration, then stays connected until
    the adapter closes the connection."""
    connection = Connection(port)
    connection.wait_for(response_to(connection.request(
        "initialize", clientID="selvane-bench", adapterID="debugpy", pathFormat="path",
        linesStartAt1=True, columnsStartAt1=True)))
    connection.request("attach", justMyCode=True)  # the editors' default, said explicitly
    connection.wait_for(lambda m: m.get("type") == "event" and m.get("event") == "initialized")
    answer = connection.wait_for(response_to(connection.request(
        "setBreakpoints", source={"path": path}, breakpoints=[{"line": line}])))
    verified = bool(answer.get("success")) and all(
        b.get("verified") for b in answer.get("body", {}).get("breakpoints", []))
    connection.wait_for(response_to(connection.request("configurationDone")))
    print(json.dumps({"breakpoint_verified": verified}), flush=True)
    connection.sock.settimeout(None)
    while connection.receive() is not None:
        pass


# ---- the program being debugged -----------------------------------------------------------


def tracer_in_use():
    """How debugpy watches this thread: a trace function, or a sys.monitoring tool."""
    if sys.gettrace() is not None:
        return "sys.settrace"
    monitoring = getattr(sys, "monitoring", None)
    if monitoring is not None and monitoring.get_tool(monitoring.DEBUGGER_ID) is not None:
        return f"sys.monitoring ({monitoring.get_tool(monitoring.DEBUGGER_ID)})"
    return None


def run_program(iterations, repeats, workloads=("main",)):
    try:
        import debugpy
    except ImportError:
        return {"skip": f"debugpy is not installed for {sys.executable}"}
    import run_bench
    import workload

    if os.environ.get("BENCH_CALLGRIND_NULL_TRACER"):
        sys.path.insert(0, os.environ["BENCH_CALLGRIND_NULL_TRACER"])
        run_bench.use_callgrind_clock()
    line = run_bench.never_reached_line(workload.never_called)
    # The same workloads untraced first, in this process: a process of its own lays out its
    # heap and code differently, which moves wall times by a few percent either way, so
    # debugpy's times are also read against this process's own untraced ones.
    untraced = {kind: [run_bench.run_once_timed(iterations, run_bench.WORKLOADS[kind])
                       for _ in range(repeats + 1)][1:] for kind in workloads}
    # The client process below is ours, not a program to debug: debugpy must not follow it.
    debugpy.configure(subProcess=False)
    host, port = debugpy.listen(("127.0.0.1", 0))
    client = subprocess.Popen(
        [sys.executable, os.path.abspath(__file__), "client", str(port), workload.__file__,
         str(line)], stdout=subprocess.PIPE, text=True)
    try:
        debugpy.wait_for_client()
        report = json.loads(client.stdout.readline() or "{}")
        if not report.get("breakpoint_verified"):
            return {"skip": f"debugpy did not verify the breakpoint ({report})"}
        tracer = tracer_in_use()
        if tracer is None:
            return {"skip": "debugpy attached but nothing traces this thread"}
        by_workload = {}
        for kind in workloads:
            work = run_bench.WORKLOADS[kind]
            times = [run_bench.run_once_timed(iterations, work) for _ in range(repeats + 1)]
            by_workload[kind] = times[1:]
        return {"times": by_workload.get("main", []), "times_by_workload": by_workload,
                "untraced_times_by_workload": untraced, "tracer": tracer,
                "debugpy": debugpy.__version__}
    finally:
        client.terminate()
        client.wait(timeout=10)


def main():
    if len(sys.argv) == 5 and sys.argv[1] == "client":
        run_client(int(sys.argv[2]), sys.argv[3], int(sys.argv[4]))
        return
    if len(sys.argv) not in (3, 4):
        sys.exit(__doc__)
    workloads = sys.argv[3].split(",") if len(sys.argv) == 4 else ["main"]
    result = run_program(int(sys.argv[1]), int(sys.argv[2]), workloads)
    print(json.dumps(result), flush=True)
    # debugpy's threads and adapter need not be waited for: the run is over.
    os._exit(0)


if __name__ == "__main__":
    main()

"""A scripted server side for the debugger core, run in a subprocess by the tests.

It initialises the core with recording callbacks, answers each stop with the next command of
a script, runs a program under the tracer and writes the list of stops as JSON to the file
named in the configuration. The program's own output and exit status pass through unchanged.

Usage: python scripted_server.py CONFIG.json

Configuration keys:
  program          path of the program to run as __main__
  out              path of the JSON file to write the stops to
  commands         list of commands, one per stop: a method name of the core ("step_into",
                   "step_over", "step_over_line", "step_out", "continue_run", "stop") or a
                   list [name, args...] ("step_over_line_range", 3, 5); ["seq", c1, c2]
                   runs several commands in one stop; "raise" raises
                   RuntimeError from the callback; ["raise_exception", "ValueError", "msg"]
                   injects an exception; "reset" resets the core from inside the callback;
                   ["exec", source] runs Python source in the callback (names: core, shared,
                   server, threading, frame)
  default          command used once the list is exhausted (default "continue_run")
  cycle            commands used in turn, over and over, once the list is exhausted (instead
                   of "default")
  first            command given before tracing starts (default "step_into")
  files            only stops in files whose base name is listed are recorded and consume
                   commands; stops elsewhere are answered with "when_elsewhere" (default:
                   only the program's file)
  when_elsewhere   command for stops outside those files (default "step_into")
  all_files        record stops in every file once the program runs, not in the code the
                   server side itself runs while it starts tracing (the differential tests)
  debug_all_threads, autoquit, idle_period, exception_mode: run-control settings
  thread_policy    {"thread name": answer} for debug_thread_cb; unknown threads answer 1
  thread_hook      the core's method that new threads start with (default
                   "bootstrap_new_thread"; "trace_dispatch" skips the start hook)
  thread_exiting   false: ending threads do not tell the core (default true)
  fail_in          "line", "return", "exception" or "idle": that callback raises once
  max_stops        stop recording (and answer continue_run) after this many stops
  count_only       record no stops, only count them (written as "stop_count")
  probe            Python expression evaluated at each recorded stop (names: core, frame,
                   shared, server, threading); its value is appended to the record
  prelude          Python source run before tracing starts (names: core, shared, threading)
  after_stop       Python expression evaluated right after stop_trace (names: core, shared,
                   sys, threading); its value is written as "after_stop"
  stop_in_atexit   stop tracing (and write the results) only at exit, after the server's
                   own bottom frame has returned
  debug_file       path of the core's debug output file
  breaks           list of set_break argument lists [file, line, enabled, temporary, cond,
                   ignore_count], set after the prelude, before tracing starts; the ids are
                   written as "break_ids"
  record_changed   append to each recorded stop the changed-breakpoint lists that the callback
                   received, as [[deleted ids], [[file, line, id, enabled, temporary, cond,
                   ignore_count, hit_count], ...]]
  import_cb        give the core an import callback that appends ["import", module name,
                   thread name] to the events
  idle_exec        Python source the idle callback runs after recording (names: core, shared,
                   server, threading, time)
  import_cb_exec   Python source that callback runs after recording (names: core, shared,
                   server, module, threading)
  sub_languages    list of "module:object" sub-language hooks (an object, or a class called
                   without arguments) registered after the prelude, before tracing starts.
                   A stop in a key frame is then recorded at the hook's translation (file
                   base name, line) with the key function's name; a stop in another frame of
                   the implementation is recorded with "impl" in place of its line, and
                   always, whatever "files" says, so that a test sees it
  wait_in          {"thread name": seconds}: that thread's first recorded stop waits up to
                   that long for shared.go (a threading.Event the program sets) and records
                   whether it came; then probe_after (an expression like probe) is recorded

The program reaches the server's shared state as `import _scripted_shared as shared`
(attributes: go, a threading.Event; tids, thread name -> tstate id; any others it sets).

Callbacks run inside the trace function while other threads may wait on the core's mutex
without the interpreter lock: they never take a lock another thread may hold (so they do not
call threading.current_thread(); thread names come from this module's own table).
"""

import atexit
import builtins
import json
import os
import runpy
import sys
import threading
import time
import types

import tvantrel30pydebugstackless as core

_MAIN_IDENT = threading.get_ident()
shared = types.ModuleType("_scripted_shared")
shared.go = threading.Event()
shared.tids = {"main": core.get_current_tstate_id()}
sys.modules["_scripted_shared"] = shared
_SELF = os.path.abspath(__file__)
_NOTHING = object()
# The interpreter's own import function: init replaces the builtins' __import__ with the
# core's hook, so a later init (from a callback, in a forked child) must not look it up again.
_DEFAULT_IMPORT = builtins.__import__


class Server:
    def __init__(self, config):
        self.config = config
        self.program = os.path.abspath(config["program"])
        self.commands = list(config.get("commands", []))
        self.default = config.get("default", "continue_run")
        self.cycle = config.get("cycle", [])
        self.cycle_index = 0
        self.when_elsewhere = config.get("when_elsewhere", "step_into")
        self.files = set(config.get("files", [os.path.basename(self.program)]))
        self.all_files = config.get("all_files", False)
        self.program_running = False  # set once tracing is on and the program starts
        self.max_stops = config.get("max_stops", 100000)
        self.fail_in = config.get("fail_in")
        self.stops = []
        self.break_ids = []
        self.stop_count = 0
        self.events = []  # quit, idle and thread-hook calls, in order
        self.thread_names = {_MAIN_IDENT: "main"}
        self.wait_in = dict(config.get("wait_in", {}))
        policy = config.get("thread_policy")
        self.thread_policy = policy
        self.frame = None  # the frame of the stop being answered
        self.debug_file = None
        self.changed = _NOTHING  # the changed-breakpoint lists of the stop being answered
        self.hooks = []  # the registered sub-language hooks

    # ---- helpers ------------------------------------------------------------------------

    def thread_label(self):
        return self.thread_names.get(threading.get_ident(), "?")

    def wanted(self, frame):
        if frame.f_code.co_filename == _SELF:
            return False
        category = self.category(frame)
        if category == 0:
            return True
        if self.all_files:
            return self.program_running
        return self.where(frame, category)[0] in self.files

    def where(self, frame, category=None):
        category = self.category(frame) if category is None else category
        if category == 1:
            file, line = self.translate(frame)
            return os.path.basename(file), line, frame.f_code.co_name
        name = os.path.basename(frame.f_code.co_filename)
        return name, frame.f_lineno if category != 0 else "impl", frame.f_code.co_name

    def category(self, frame):
        """The core's sub-language category of a frame of the calling thread."""
        if not self.hooks:
            return -1
        return core.sub_language_get_frame_category(core.get_current_tstate_id(), frame)

    def translate(self, frame):
        hook = core.sub_language_get_active_hook(core.get_current_tstate_id())
        return hook._TranslateFrame(frame, 0)

    def next_command(self):
        if self.commands:
            return self.commands.pop(0)
        if self.cycle:
            self.cycle_index += 1
            return self.cycle[(self.cycle_index - 1) % len(self.cycle)]
        return self.default

    def run_command(self, command):
        if isinstance(command, str):
            command = [command]
        name, args = command[0], command[1:]
        if name == "seq":
            for part in args:
                self.run_command(part)
            return
        if name == "raise":
            raise RuntimeError("callback failure")
        if name == "raise_exception":
            if args[0] is None:
                core.raise_exception(0, None)
            else:
                core.raise_exception(0, getattr(builtins, args[0])(*args[1:]))
            core.step_into()
            return
        if name == "reset":
            core.reset()
            return
        if name == "exec":
            exec(args[0], {"core": core, "shared": shared, "server": self,
                           "threading": threading, "frame": self.frame})
            return
        getattr(core, name)(*args)

    def init_core(self):
        """Initialises the core with this server's callbacks (also from inside a callback)."""
        import_cb = self.import_cb if self.config.get("import_cb") else None
        core.init(float(self.config.get("idle_period", 0.0)),
                  int(self.config.get("exception_mode", 0)), self.install_thread_hooks_cb,
                  self.idle_cb, self.line_cb, self.return_cb, self.exception_cb, self.quit_cb,
                  import_cb, _DEFAULT_IMPORT, self.debug_file, {_SELF: 1})

    def stop(self, kind, frame, extra=_NOTHING, changed=_NOTHING):
        # "exec" commands see the frame of this stop only: holding it longer would change
        # when the program's objects die, and so which code runs traced.
        self.frame = frame
        self.changed = changed
        try:
            self.answer(kind, frame, extra)
        finally:
            self.frame = None
            self.changed = _NOTHING

    def answer(self, kind, frame, extra):
        if self.fail_in == kind:
            self.fail_in = None
            raise RuntimeError(f"{kind} callback failure")
        if self.config.get("count_only"):
            self.stop_count += 1
            self.run_command(self.next_command())
            return
        if not self.wanted(frame) or len(self.stops) >= self.max_stops:
            self.run_command(self.when_elsewhere if len(self.stops) < self.max_stops
                             else "continue_run")
            return
        file, line, func = self.where(frame)
        record = [kind, file, line, func]
        if extra is not _NOTHING:
            record.append(extra)
        if self.config.get("record_threads"):
            record.append(self.thread_label())
        if self.config.get("record_curr_frame"):
            tid = core.get_current_tstate_id()
            record.append(core.get_curr_frame(tid) is frame)
        if self.config.get("record_changed"):
            record.append(_jsonable(self.changed))
        if "probe" in self.config:
            names = {"core": core, "frame": frame, "shared": shared, "server": self,
                     "threading": threading, "outermost": outermost, "sys": sys}
            record.append(eval(self.config["probe"], names))
        label = self.thread_label()
        if label in self.wait_in:
            record.append(shared.go.wait(self.wait_in.pop(label)))
            if "probe_after" in self.config:
                names = {"core": core, "frame": frame, "shared": shared, "server": self,
                         "threading": threading, "outermost": outermost}
                record.append(eval(self.config["probe_after"], names))
        self.stops.append(record)
        self.run_command(self.next_command())

    # ---- callbacks ----------------------------------------------------------------------

    def line_cb(self, frame, changed):
        self.stop("line", frame, changed=changed)

    def return_cb(self, frame, value, changed):
        self.stop("return", frame, _summary(value), changed)

    def exception_cb(self, frame, exc_arg, changed):
        self.stop("exception", frame, exc_arg[0].__name__, changed)

    def import_cb(self, module):
        self.events.append(["import", getattr(module, "__name__", repr(module)),
                            self.thread_label()])
        if "import_cb_exec" in self.config:
            exec(self.config["import_cb_exec"], {"core": core, "shared": shared, "server": self,
                                                 "module": module, "threading": threading})

    def quit_cb(self):
        self.events.append(["quit", self.thread_label()])

    def idle_cb(self):
        self.events.append(["idle"])
        if "idle_exec" in self.config:
            exec(self.config["idle_exec"], {"core": core, "shared": shared, "server": self,
                                            "threading": threading, "time": time})
        if self.fail_in == "idle":
            self.fail_in = None
            raise RuntimeError("idle callback failure")

    def install_thread_hooks_cb(self, flag):
        self.events.append(["thread_hooks", flag])
        hook = getattr(core, self.config.get("thread_hook", "bootstrap_new_thread"))
        threading.settrace(hook if flag else None)

    def debug_thread_cb(self, identity):
        name = self.thread_names.get(identity, "?")
        answer = self.thread_policy.get(name, 1)
        self.events.append(["policy", name, answer])
        if answer == "raise":
            raise RuntimeError("policy failure")
        return answer


def outermost(frame):
    while frame.f_back is not None:
        frame = frame.f_back
    return frame


def _summary(value):
    if value is None or isinstance(value, (int, float, str, bool)):
        return value
    return type(value).__name__


def _jsonable(value):
    if value is _NOTHING:
        return "(none)"
    if isinstance(value, (list, tuple)):
        return [_jsonable(v) for v in value]
    if value is None or isinstance(value, (int, float, str, bool)):
        return value
    return repr(value)


def _patch_thread_start(server):
    """Names threads in our own table and tells the core when a thread ends."""
    original = threading.Thread._bootstrap_inner

    def _bootstrap_inner(self):
        server.thread_names[threading.get_ident()] = self.name
        shared.tids[self.name] = core.get_current_tstate_id()
        try:
            original(self)
        finally:
            if server.config.get("thread_exiting", True):
                core.thread_exiting()

    threading.Thread._bootstrap_inner = _bootstrap_inner


def main(config_path):
    with open(config_path) as f:
        config = json.load(f)
    server = Server(config)
    _patch_thread_start(server)
    shared.server = server
    server.debug_file = open(config["debug_file"], "w") if "debug_file" in config else None
    server.init_core()
    if "debug_all_threads" in config:
        core.set_debug_all_threads(int(config["debug_all_threads"]))
    if "autoquit" in config:
        core.set_autoquit(int(config["autoquit"]))
    if server.thread_policy is not None:
        core.set_debug_thread_cb(server.debug_thread_cb)
    # Like a debugger's own runner, the frame that runs the program is marked: its handlers,
    # and every `with` block and call into C from it outward, are not the program's.
    core.set_ignored_exception_handlers({runpy._run_code.__code__: 1})
    if "prelude" in config:
        exec(config["prelude"], {"core": core, "shared": shared, "threading": threading})
    for spec in config.get("sub_languages", []):
        module_name, _, name = spec.partition(":")
        hook = getattr(__import__(module_name, fromlist=["_"]), name)
        hook = hook() if isinstance(hook, type) else hook
        core.register_sub_language_hook(hook)
        server.hooks.append(hook)
    server.break_ids = [core.set_break(*args) for args in config.get("breaks", [])]
    sys.argv = [server.program]
    # As `python program.py` does: the program's folder comes first on the import path.
    sys.path.insert(0, os.path.dirname(server.program))
    server.run_command(config.get("first", "step_into"))
    core.start_trace()
    server.program_running = True
    if config.get("stop_in_atexit"):
        atexit.register(finish, server, config)
        runpy.run_path(server.program, run_name="__main__")
        return
    try:
        runpy.run_path(server.program, run_name="__main__")
    finally:
        finish(server, config)


def finish(server, config):
    core.stop_trace()
    result = {"stops": server.stops, "stop_count": server.stop_count, "events": server.events,
              "threads_after": len(core.get_threads()), "tracing_after_stop": core.get_tracing(),
              "break_ids": server.break_ids}
    if "after_stop" in config:
        names = {"core": core, "shared": shared, "sys": sys, "threading": threading}
        result["after_stop"] = eval(config["after_stop"], names)
    with open(config["out"], "w") as f:
        json.dump(result, f)


if __name__ == "__main__":
    main(sys.argv[1])

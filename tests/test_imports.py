"""The import hook and the module registry: the replacement __import__, the import callback,
the list of modules executed since the server side last asked, and register_module.

Traced programs run in a subprocess under scripted_server.py, whose import callback (config
key import_cb) records ["import", module name, thread name] in the run's events. The modules
the tests write live in the test's folder; the standard library's own imports during a run
are filtered out by name or folder.

How the expectations are made: every call of the replacement __import__ while tracing calls
the import callback once with the module it returns, unless an import callback is already
running; every execution of a module's top-level code in a traced thread (an import, a
reload, runpy, importlib.import_module, exec of code compiled with a file name) appends that
file's full name to the new-imports list, and nothing else does.
"""

import builtins
import os
import re
import sys
import textwrap
import types

import pytest

import tvantrel30pydebugstackless as core
from conftest import MONITORING, assert_stops, ok, run_plain, run_traced, write_program
from core_args import ORIGINAL_IMPORT, init_args

CONTINUE = dict(first="continue_run", default="continue_run", when_elsewhere="continue_run")

MODULES = {
    "mods/alpha.py": """
        import delta
        value = "alpha"
    """,
    "mods/beta.py": """
        value = "beta"
    """,
    "mods/gamma.py": """
        print("gamma ran as", __name__)
    """,
    "mods/delta.py": """
        value = "delta"
    """,
    "mods/epsilon.py": """
        value = "epsilon"
    """,
    "mods/helper.py": """
        def work(n):
            a = n + 1  # helper
            return a * 2
    """,
    "mods/pkg/__init__.py": """
        value = "pkg"
    """,
    "mods/pkg/sub.py": """
        class Inner:
            x = 1
        value = "sub"
    """,
    "script.py": """
        print("script ran as", __name__)
    """,
}
NAMES = {"alpha", "beta", "gamma", "delta", "epsilon", "helper", "pkg", "pkg.sub", "sync"}


def traced(tmp_path, source, **config):
    """Traces `source` as prog.py with MODULES written beside it (mods/ is put on sys.path by
    the program itself); the traced run must print what an untraced run prints."""
    for name, text in MODULES.items():
        os.makedirs(os.path.dirname(str(tmp_path / name)), exist_ok=True)
        (tmp_path / name).write_text(textwrap.dedent(text).lstrip("\n"))
    program = write_program(tmp_path, "import os, sys\n"
                            "sys.path.insert(0, os.path.join(os.path.dirname(__file__), 'mods'))\n"
                            + textwrap.dedent(source).lstrip("\n"))
    run = run_traced(tmp_path, program, **dict(CONTINUE, **config))
    plain = run_plain(tmp_path, program)
    assert run.stdout == plain.stdout, run.stderr
    assert run.returncode == plain.returncode, run.stderr
    return ok(run)


def ours(tmp_path, paths):
    """The entries of a new-imports list that are files of this test, relative to its folder."""
    prefix = str(tmp_path) + os.sep
    return [p[len(prefix):] for p in paths if p.startswith(prefix)]


def import_events(run, names=NAMES):
    return [e[1:] for e in run.events if e[0] == "import" and e[1] in names]


# ---- the new-imports list -------------------------------------------------------------------


EXECUTIONS = """
import importlib, runpy
import beta
import beta
importlib.reload(beta)
gamma = importlib.import_module("gamma")
runpy.run_module("gamma")
runpy.run_path(os.path.join(os.path.dirname(__file__), "script.py"))
from pkg import sub
exec(compile("x = 1", "<string>", "exec"), {})
exec("y = 2", {})
exec(compile("z = 3", os.path.join(os.path.dirname(__file__), "compiled.py"), "exec"), {})
class Local:
    w = 4
print("done")
"""


def test_every_execution_of_module_code_is_listed_once(tmp_path):
    run = traced(tmp_path, EXECUTIONS, after_stop="[core.get_new_imports(), "
                                                  "core.get_new_imports()]")
    listed, again = run.after_stop
    assert ours(tmp_path, listed) == [
        "prog.py",             # the program itself, run by runpy
        "mods/beta.py",        # the first import; the second one executes nothing
        "mods/beta.py",        # the reload executes it again
        "mods/gamma.py",       # importlib.import_module
        "mods/gamma.py",       # runpy.run_module
        "script.py",           # runpy.run_path
        "mods/pkg/__init__.py",
        "mods/pkg/sub.py",     # a class body is not module code
        "compiled.py",         # code compiled with a file name; "<string>" never counts
    ]
    assert again == []


# The list keeps every execution up to this many entries; past it only paths not listed yet.
LIST_LIMIT = 10000

REPEATED_EXECUTIONS = """
import tvantrel30pydebugstackless as core
try:
    import _scripted_shared as shared
except ImportError:  # the untraced run
    import types
    shared = types.ModuleType("plain")
here = os.path.dirname(__file__)
code = compile("z = 3", os.path.join(here, "compiled.py"), "exec")
for _ in range(LIMIT + 500):
    exec(code, {})
exec(compile("w = 1", os.path.join(here, "other.py"), "exec"), {})
exec(code, {})
shared.full = core.get_new_imports()
exec(code, {})
exec(code, {})
print("done")
"""


def test_a_list_nobody_fetches_stops_growing_with_repeated_executions(tmp_path):
    """Module code executed over and over while the list is not fetched: every execution is
    listed until the limit, then only paths not listed yet; a fetched list starts afresh."""
    run = traced(tmp_path, REPEATED_EXECUTIONS.replace("LIMIT", str(LIST_LIMIT)),
                 after_stop="[shared.full, core.get_new_imports()]")
    full, after_fetch = run.after_stop
    assert len(full) == LIST_LIMIT + 1
    kept = ours(tmp_path, full[:LIST_LIMIT])
    assert kept[0] == "prog.py"
    assert set(kept[1:]) == {"compiled.py"}
    # Until the limit every execution counts: what is not ours came before the loop.
    assert full[LIST_LIMIT - 1] == full[LIST_LIMIT - 2] == str(tmp_path / "compiled.py")
    assert ours(tmp_path, full[LIST_LIMIT:]) == ["other.py"]
    assert ours(tmp_path, after_fetch) == ["compiled.py", "compiled.py"]


def test_the_list_is_handed_over_not_copied(tmp_path):
    source = """
    import beta
    print("between")  # fetch
    import delta
    """
    prog = str(tmp_path / "prog.py")
    fetch = 2 + 2  # after the two lines traced() puts in front
    run = traced(tmp_path, source, breaks=[[prog, fetch, 1, 0, None, 0]],
                 commands=[["exec", "shared.first = core.get_new_imports()"]],
                 after_stop="[shared.first, core.get_new_imports()]")
    assert len(run.stops) == 1 and run.stops[0][2] == fetch
    first, second = run.after_stop
    assert ours(tmp_path, first) == ["prog.py", "mods/beta.py"]
    assert ours(tmp_path, second) == ["mods/delta.py"]


def test_imports_in_an_untraced_thread_are_not_listed_until_it_is_traced(tmp_path):
    # Module code that runs while the thread is not traced is not seen as executed.
    source = """
    import threading
    t = threading.Thread(target=__import__, args=("beta",))
    t.start()
    t.join()
    """
    run = traced(tmp_path, source, thread_policy={"Thread-1": 0, "Thread-1 (__import__)": 0},
                 after_stop="core.get_new_imports()")
    assert ours(tmp_path, run.after_stop) == ["prog.py"]


# ---- the import callback --------------------------------------------------------------------


CALLBACKS = """
import importlib
import alpha
import alpha
from pkg import sub
import pkg.sub
beta = importlib.import_module("beta")
importlib.reload(alpha)
__import__("epsilon", globals(), None, [], 0)
"""


def test_the_import_callback_runs_once_per_import(tmp_path):
    run = traced(tmp_path, CALLBACKS, import_cb=True, after_stop="core.get_new_imports()")
    assert import_events(run) == [
        ["delta", "main"],    # alpha's own import, done while alpha's code runs
        ["alpha", "main"],
        ["alpha", "main"],    # imported already: the callback runs, nothing is executed
        ["pkg", "main"],      # from pkg import sub: one call of __import__
        ["pkg", "main"],      # import pkg.sub answers the package
        # importlib.import_module and reload do not go through __import__, but the reloaded
        # alpha's own import statement does
        ["delta", "main"],
        ["epsilon", "main"],
    ]
    # A module is listed when its code starts: alpha before the delta it imports.
    assert ours(tmp_path, run.after_stop) == [
        "prog.py", "mods/alpha.py", "mods/delta.py", "mods/pkg/__init__.py", "mods/pkg/sub.py",
        "mods/beta.py", "mods/alpha.py", "mods/epsilon.py"]


def test_modules_loaded_before_tracing_are_given_to_the_callback_when_tracing_starts(tmp_path):
    run = traced(tmp_path, "print(1)\n", import_cb=True,
                 prelude="import sys, os; sys.path.insert(0, os.path.abspath('mods')); "
                         "import beta")
    names = [e[1] for e in run.events if e[0] == "import"]
    start = run.events.index(["thread_hooks", 1])
    assert ["import", "beta", "main"] in run.events[:start]
    assert names.count("beta") == 1
    # sys and the core itself are loaded modules too.
    assert "sys" in names[:start] and "tvantrel30pydebugstackless" in names[:start]


def test_an_import_inside_the_callback_does_not_call_it_again(tmp_path):
    source = """
    import alpha
    import epsilon
    print(epsilon.value)
    """
    run = traced(tmp_path, source, import_cb=True,
                 import_cb_exec="if module.__name__ == 'alpha':\n    import epsilon",
                 after_stop="core.get_new_imports()")
    assert import_events(run) == [["delta", "main"], ["alpha", "main"], ["epsilon", "main"]]
    # epsilon's code ran inside the callback, where nothing is traced: it is never listed.
    assert ours(tmp_path, run.after_stop) == ["prog.py", "mods/alpha.py", "mods/delta.py"]


def test_nothing_stops_while_the_import_callback_runs(tmp_path):
    # The callback calls helper.work, which has a breakpoint and is stepped into when the
    # program calls it: only the program's own call stops.
    source = """
    import helper
    import alpha
    print(helper.work(1))
    """
    helper_line = 2
    helper = str(tmp_path / "mods" / "helper.py")
    run = traced(tmp_path, source, import_cb=True, files=["helper.py"],
                 breaks=[[helper, helper_line, 1, 0, None, 0]],
                 import_cb_exec="if module.__name__ == 'alpha':\n"
                                "    import helper\n    helper.work(5)",
                 commands=["step_into", "step_into"], probe="frame.f_locals['n']")
    assert_stops(run.stops, [("line", "helper.py", 2, "work", 1),
                             ("line", "helper.py", 3, "work", 1),
                             ("return", "helper.py", 3, "work", 4, 1)])


def test_an_import_callback_that_raises_changes_nothing_for_the_program(tmp_path):
    source = """
    try:
        raise KeyError("kept")
    except KeyError:
        import alpha
        from pkg import sub
        print(alpha.value, sub.value, repr(sys.exc_info()[1]))
    print(sys.exc_info())
    try:
        import no_such_module_here
    except ImportError as e:
        print(type(e).__name__, e.name)
    """
    run = traced(tmp_path, source, import_cb=True, import_cb_exec="raise RuntimeError('cb')")
    assert run.stdout == ("alpha sub KeyError('kept')\n(None, None, None)\n"
                          "ModuleNotFoundError no_such_module_here\n")
    assert ["alpha", "main"] in import_events(run)
    assert "Traceback" not in run.stderr


def test_a_failed_import_passes_its_error_through(tmp_path):
    source = """
    for name in ("no_such_module_here", "os.no_such_sub"):
        try:
            __import__(name)
        except ImportError as e:
            print(type(e).__name__, e.name)
    try:
        from beta import nothing_there
    except ImportError as e:
        print(type(e).__name__, e.name)
    """
    run = traced(tmp_path, source, import_cb=True)
    assert run.stdout == ("ModuleNotFoundError no_such_module_here\n"
                          "ModuleNotFoundError os.no_such_sub\n"
                          "ImportError beta\n")
    # The failed imports call no callback; `from beta import ...` imported beta.
    assert import_events(run) == [["beta", "main"]]


def test_the_callback_guard_is_shared_by_all_threads(tmp_path):
    # While the main thread's callback for alpha runs, a worker imports beta: no callback
    # starts for it. The worker's import is still seen as executed module code.
    (tmp_path / "mods").mkdir(exist_ok=True)
    (tmp_path / "mods" / "sync.py").write_text(
        "import threading\ngo = threading.Event()\ndone = threading.Event()\n")
    source = """
    import threading
    import sync

    def worker():
        sync.go.wait(10)
        import beta
        sync.done.set()

    t = threading.Thread(target=worker, name="worker")
    t.start()
    import alpha
    sync.go.set()
    sync.done.wait(10)
    t.join()
    import beta
    print("joined")
    """
    run = traced(tmp_path, source, import_cb=True,
                 import_cb_exec=("if module.__name__ == 'alpha':\n"
                                 "    import sys\n"
                                 "    sys.modules['sync'].go.set()\n"
                                 "    shared.worker_done = sys.modules['sync'].done.wait(10)"),
                 after_stop="[shared.worker_done, core.get_new_imports()]")
    done, listed = run.after_stop
    assert done is True
    assert import_events(run) == [["sync", "main"], ["delta", "main"], ["alpha", "main"],
                                  ["beta", "main"]]
    assert "mods/beta.py" in ours(tmp_path, listed)


def test_a_thread_first_seen_at_an_import_is_traced_from_then_on(tmp_path):
    # A thread started below threading (no start hook) runs untraced until it imports.
    source = """
    import _thread, threading
    import helper
    done = threading.Event()

    def worker():
        helper.work(1)
        import beta
        helper.work(2)
        done.set()

    _thread.start_new_thread(worker, ())
    done.wait(10)
    print("ok")
    """
    helper = str(tmp_path / "mods" / "helper.py")
    run = traced(tmp_path, source, files=["helper.py"],
                 breaks=[[helper, 2, 1, 0, None, 0]], probe="frame.f_locals['n']")
    # sys.monitoring reports every thread from its start: there is nothing to wait for.
    expected = [("line", "helper.py", 2, "work", 2)]
    if MONITORING:
        expected.insert(0, ("line", "helper.py", 2, "work", 1))
    assert_stops(run.stops, expected)


HOOK_CALLS = re.compile(r"^(\d+) IMPORT HOOK CALLS WERE MADE$", re.M)


def test_each_import_statement_is_one_call_of_the_hook(tmp_path):
    counts = []
    # Modules loaded already: the import machinery, which makes imports of its own while it
    # loads a file, does not run.
    for extra in ("", "import os\nimport os.path\nfrom sys import argv\n"):
        log = tmp_path / "debug.txt"
        traced(tmp_path, extra + "print('x')\n", debug_file=str(log))
        counts.append([int(n) for n in HOOK_CALLS.findall(log.read_text())])
    # The three statements are three calls.
    assert len(counts[0]) == 1 and counts[1] == [counts[0][0] + 3]


# ---- in this process: the hook itself, register_module, set_import_cb ------------------------


def is_the_hook(function):
    """The core's replacement __import__ as it goes into the builtins: the module's method,
    shown as a function of the builtins module."""
    return (type(function) is type(core.__import__) and function.__name__ == "__import__"
            and function.__self__ is builtins and function is not ORIGINAL_IMPORT)


@pytest.fixture
def initialised():
    core.init(*init_args())
    yield
    core.set_import_cb(None)
    core.reset()


def test_method_docstrings():
    assert core.get_new_imports.__doc__ == (
        "Used to obtain list of full path names for modules that have been\n"
        "loaded or reloaded since the last call to this function.  Also clears\n"
        "the table of new loaded/reloaded modules to blank.")
    assert core.set_import_cb.__doc__ == (
        "Set the callback called when a module is imported (may be None)")
    assert core.register_module.__doc__ == "Register module with the debugger"
    assert not core.__import__.__doc__


def test_init_puts_the_hook_into_the_builtins(initialised):
    hook = builtins.__import__
    assert hook is not ORIGINAL_IMPORT
    assert hook.__name__ == core.__import__.__name__ == "__import__"
    assert core.__import__.__module__ == "builtins"
    # Shown as the builtins module's own function, as the interpreter's __import__ is.
    assert hook.__self__ is builtins is ORIGINAL_IMPORT.__self__
    assert hook.__module__ == ORIGINAL_IMPORT.__module__ == "builtins"
    calls = core.get_new_imports()
    assert hook("json") is __import__("json")
    del calls
    import json  # noqa: F401 -- an import statement goes through it
    assert core.__import__("os") is os


def test_the_hook_has_the_interpreters_signature_and_no_docstring(initialised):
    import inspect
    expected = "(name, globals=None, locals=None, fromlist=(), level=0)"
    assert str(inspect.signature(ORIGINAL_IMPORT)) == expected
    for hook in (builtins.__import__, core.__import__):
        assert str(inspect.signature(hook)) == expected
        assert hook.__doc__ is None


def test_the_hook_takes_keywords(initialised):
    assert core.__import__(name="os") is os
    assert core.__import__("os.path", globals(), None, ["join"], 0) is os.path
    assert core.__import__("os.path", fromlist=["join"]) is os.path
    assert core.__import__("os.path") is os
    assert core.__import__(name="path", globals={"__package__": "os", "__name__": "os.x"},
                           level=1) is os.path
    with pytest.raises(TypeError):
        core.__import__("os", no_such_keyword=1)
    with pytest.raises(ModuleNotFoundError):
        core.__import__("no_such_module_here")
    with pytest.raises(ValueError):
        core.__import__("os", level=-1)


def test_init_refuses_our_own_hook_as_the_default_import(initialised):
    with pytest.raises(AssertionError,
                       match="^The default import hook cannot be equal to our import hook$"):
        core.init(*init_args(default_import=builtins.__import__))
    core.init(*init_args())
    assert is_the_hook(builtins.__import__)


def test_the_hook_goes_into_the_builtins_the_initialising_code_sees():
    own = dict(vars(builtins))
    own["__import__"] = ORIGINAL_IMPORT
    builtins.__import__ = ORIGINAL_IMPORT
    try:
        exec("core.init(*args)", {"__builtins__": own, "core": core, "args": init_args()})
        assert is_the_hook(own["__import__"])
        assert builtins.__import__ is ORIGINAL_IMPORT
    finally:
        core.init(*init_args())
        core.reset()
    assert is_the_hook(builtins.__import__)


def test_register_module_answers_the_full_path_and_calls_the_callback(initialised, tmp_path,
                                                                      monkeypatch):
    seen = []
    core.set_import_cb(seen.append)
    assert core.register_module(os) == os.path.abspath(os.__file__)
    monkeypatch.chdir(tmp_path)
    relative = types.ModuleType("relative")
    relative.__file__ = "sub/./x/../mod.py"
    assert core.register_module(relative) == str(tmp_path) + "/sub/mod.py"
    nameless = types.ModuleType("nameless")
    assert core.register_module(nameless) is None
    pseudo = types.ModuleType("pseudo")
    pseudo.__file__ = "<frozen pseudo>"
    assert core.register_module(pseudo) is None
    assert seen == [os, relative, nameless, pseudo]
    core.set_import_cb(None)
    core.register_module(os)
    assert len(seen) == 4


def test_register_module_gives_the_module_file_to_its_functions(initialised, tmp_path):
    # The function's code names another, readable file, which is what its frames show until
    # the module is registered.
    other = tmp_path / "other.py"
    other.write_text("")
    module = types.ModuleType("made")
    module.__file__ = str(tmp_path / "made.py")
    exec(compile("def f():\n    import sys\n    return sys._getframe()\n", str(other), "exec"),
         module.__dict__)
    assert core.get_frame_file(module.f()) == str(other)
    assert core.register_module(module) == str(tmp_path / "made.py")
    assert core.get_frame_file(module.f()) == str(tmp_path / "made.py")


def test_set_import_cb_replaces_the_callback_and_keeps_one_reference(initialised):
    def first(module):
        calls.append(("first", module.__name__))

    def second(module):
        calls.append(("second", module.__name__))

    calls = []
    before = sys.getrefcount(first)
    assert core.set_import_cb(first) is None
    assert sys.getrefcount(first) == before + 1
    core.register_module(os)
    core.set_import_cb(second)
    assert sys.getrefcount(first) == before
    core.register_module(sys)
    assert calls == [("first", "os"), ("second", "sys")]


def test_the_new_imports_list_is_empty_after_init(initialised):
    assert core.get_new_imports() == []
    assert core.get_new_imports() == []


def test_no_thread_stops_by_stepping_while_an_import_callback_runs(tmp_path):
    # A worker steps into its own lines while the main thread's import callback runs: none
    # of them stops. Without the callback in the way (the control run) the same lines stop.
    (tmp_path / "mods").mkdir(exist_ok=True)
    (tmp_path / "mods" / "sync.py").write_text(
        "import threading\ngo = threading.Event()\ndone = threading.Event()\n")
    source = """
    import threading
    import sync
    under_debugger = "_scripted_shared" in sys.modules
    if under_debugger:
        import tvantrel30pydebugstackless as core

    def worker():
        sync.go.wait(10)
        if under_debugger:
            core.step_into()
        a = 1
        b = a + 1
        if under_debugger:
            core.continue_run()
        sync.done.set()

    t = threading.Thread(target=worker, name="worker")
    t.start()
    import alpha
    sync.go.set()
    sync.done.wait(10)
    t.join()
    print("joined")
    """
    waiting = ("if module.__name__ == 'alpha':\n"
               "    import sys\n"
               "    sys.modules['sync'].go.set()\n"
               "    sys.modules['sync'].done.wait(10)")
    run = traced(tmp_path, source, import_cb=True, import_cb_exec=waiting,
                 record_threads=True)
    assert_stops(run.stops, [])
    control = traced(tmp_path, source, record_threads=True)
    # The first line after step_into stops (the answer is continue_run); traced() puts two
    # lines in front of the source.
    assert [s[2] for s in control.stops] == [13], control.stops
    assert {s[-1] for s in control.stops} == {"worker"}


def test_the_hook_goes_into_the_builtins_module_when_no_frame_runs():
    # A thread started at a C function has no Python frame: init called that way installs
    # the hook in the builtins module's dictionary.
    import _thread
    import time
    builtins.__import__ = ORIGINAL_IMPORT
    try:
        _thread.start_new_thread(core.init, tuple(init_args()))
        deadline = time.monotonic() + 10
        while builtins.__import__ is ORIGINAL_IMPORT and time.monotonic() < deadline:
            time.sleep(0.005)
        assert is_the_hook(builtins.__import__)
    finally:
        core.init(*init_args())
        core.reset()

"""The module's face: loading, init's argument contract, lifecycle, run-control settings,
thread queries and the thread-state utilities, exercised in this process (nothing here
starts tracing; the tracing tests run their programs in a subprocess)."""

import io
import sys
import threading

import pytest

import tvantrel30pydebugstackless as core
from core_args import init_args, noop


class Collector(io.StringIO):
    """A debug file that remembers what the core wrote."""


@pytest.fixture(autouse=True)
def fresh_core():
    core.init(*init_args())
    yield
    core.init(*init_args())
    core.reset()


def assert_core_still_works():
    """After a rejected call the core must answer as before."""
    core.init(*init_args())
    assert core.get_tracing() == 0
    core.step_into()
    assert core.get_tracing() == 1
    core.reset()
    assert core.get_tracing() == 0


# ---- init ---------------------------------------------------------------------------------


def test_init_accepts_none_import_cb():
    assert core.init(*init_args(import_cb=None)) is None


def test_init_rejects_non_callable_import_cb():
    with pytest.raises(TypeError, match=r"^import_cb must be None or callable$"):
        core.init(*init_args(import_cb=3))
    assert_core_still_works()


def test_init_accepts_dict_subclass_and_rejects_list():
    class Modules(dict):
        pass

    assert core.init(*init_args(internal_modules_map=Modules())) is None
    with pytest.raises(TypeError, match=r"^internal_modules_map must be a dict$"):
        core.init(*init_args(internal_modules_map=[]))
    assert_core_still_works()


def test_init_reports_only_the_first_failing_check():
    with pytest.raises(TypeError) as info:
        core.init(*init_args(install_thread_hooks_cb=1, idle_cb=2))
    assert str(info.value) == "install_thread_hooks_cb must be callable"


@pytest.mark.parametrize("name, message", [
    ("install_thread_hooks_cb", "install_thread_hooks_cb must be callable"),
    ("idle_cb", "idle_cb must be callable"),
    ("line_cb", "line_cb must be callable"),
    ("return_cb", "return_cb must be callable"),
    ("exception_cb", "exception_cb must be callable"),
    ("quit_cb", "quit_cb must be callable"),
    ("import_cb", "import_cb must be None or callable"),
    ("default_import", "default_import must be callable"),
    ("internal_modules_map", "internal_modules_map must be a dict"),
])
def test_init_check_messages(name, message):
    with pytest.raises(TypeError) as info:
        core.init(*init_args(**{name: "not callable"}))
    assert str(info.value) == message
    assert_core_still_works()


def test_init_checks_come_in_table_order():
    args = init_args(quit_cb=1, import_cb=2, default_import=3, internal_modules_map=4)
    with pytest.raises(TypeError, match="^quit_cb must be callable$"):
        core.init(*args)


@pytest.mark.parametrize("args, text", [
    ((), "tracer_init"),
    (("x",) + tuple(init_args()[1:]), "real number"),
    (tuple(init_args()[:1]) + ("mode",) + tuple(init_args()[2:]), "integer"),
    (tuple(init_args()) + (1,), "tracer_init"),
])
def test_init_parse_errors_are_the_interpreters(args, text):
    with pytest.raises(TypeError) as info:
        core.init(*args)
    assert text in str(info.value)
    assert_core_still_works()


def test_dprintf_file_of_any_type_is_accepted():
    for anything in (42, "text", object(), None):
        assert core.init(*init_args(dprintf_file=anything)) is None
    core.reset()  # writing to such a "file" fails silently


# ---- debug output -------------------------------------------------------------------------


# What init prints on the lifecycle channel: its banner, the installation of the import hook
# into the builtins, and its end.
INIT_MESSAGES = ("INIT CORE\n"
                 "********************* INSTALLING TRACE HOOK ***********************\n"
                 "********************* DONE INSTALLING TRACE HOOK ***********************\n"
                 "DONE WITH INIT VANTREL\n")


def test_init_and_destroy_messages():
    log = Collector()
    core.init(*init_args(dprintf_file=log))
    assert log.getvalue() == INIT_MESSAGES
    log.seek(0)
    log.truncate()
    core.destroy()
    text = log.getvalue()
    assert text.count("DESTROY REACHED\n") == 2
    assert text.startswith("DESTROY REACHED\nDESTROY REACHED\n")
    assert "RESET THREAD TABLE\n" in text
    assert "in __tracer_stop_trace()\n" in text


def test_second_init_prints_the_start_banner_to_the_old_file():
    log = Collector()
    core.init(*init_args(dprintf_file=log))
    core.init(*init_args(dprintf_file=log))
    assert log.getvalue().count("STARTING VANTREL INIT\n") == 1


def test_reset_message():
    log = Collector()
    core.init(*init_args(dprintf_file=log))
    core.reset()
    assert log.getvalue().startswith(INIT_MESSAGES + "RESET REACHED\n")


def test_dprintf_none_releases_the_file_and_silences():
    log = Collector()
    before = sys.getrefcount(log)
    core.init(*init_args(dprintf_file=log))
    assert sys.getrefcount(log) == before + 1
    core.init(*init_args(dprintf_file=None))
    assert sys.getrefcount(log) == before
    written = log.getvalue()
    core.reset()
    assert log.getvalue() == written


def test_debug_output_keeps_the_pending_exception_of_a_failing_file():
    class Broken:
        def write(self, text):
            raise OSError("disk full")

        def flush(self):
            raise OSError("still full")

    core.init(*init_args(dprintf_file=Broken()))
    core.reset()  # prints; the file's errors must not escape
    assert_core_still_works()


# ---- lifecycle and run control ------------------------------------------------------------


def test_get_tracing_is_zero_after_init():
    assert core.get_tracing() == 0


def test_step_into_ignores_extra_arguments_and_creates_the_record():
    assert core.step_into(1, 2, 3) is None
    assert core.get_tracing() == 1
    assert core.get_threads() == [core.get_current_tstate_id()]


def test_reset_clears_the_thread_table():
    core.step_into()
    core.reset()
    assert core.get_threads() == []
    assert core.get_tracing() == 0


def test_settings_parse_and_reject():
    assert core.set_autoquit(0) is None
    assert core.set_idle_period(0.5) is None
    assert core.set_debug_all_threads(0) is None
    with pytest.raises(TypeError):
        core.set_autoquit("x")
    with pytest.raises(TypeError):
        core.set_idle_period("x")
    with pytest.raises(TypeError):
        core.set_debug_all_threads(None)
    assert_core_still_works()


def test_set_debug_thread_cb_accepts_none_and_anything():
    assert core.set_debug_thread_cb(None) is None
    assert core.set_debug_thread_cb(noop) is None
    with pytest.raises(TypeError):
        core.set_debug_thread_cb()
    assert_core_still_works()


def test_set_debug_thread_cb_holds_one_reference():
    def cb(ident):
        return 1

    before = sys.getrefcount(cb)
    core.set_debug_thread_cb(cb)
    assert sys.getrefcount(cb) == before + 1
    core.set_debug_thread_cb(None)
    assert sys.getrefcount(cb) == before
    core.set_debug_thread_cb(cb)
    with pytest.raises(TypeError):
        core.set_debug_thread_cb(1, 2)
    assert sys.getrefcount(cb) == before  # the failed call dropped the old callback


def test_thread_queries_for_unknown_threads():
    with pytest.raises(IndexError, match="^get_curr_frame called for unknown or terminated thread$"):
        core.get_curr_frame(12345)
    assert core.get_thread_name(12345) is None
    assert core.get_thread_ident_for_tstate_id(12345) is None


def test_thread_queries_for_the_calling_thread():
    core.step_into()
    tid = core.get_current_tstate_id()
    assert core.get_curr_frame(tid) is None
    assert core.get_thread_name(tid) is None
    assert core.get_thread_ident_for_tstate_id(tid) == threading.get_ident()
    assert core.is_botframe(sys._getframe()) == 0


def test_positional_methods_reject_missing_arguments():
    for method in (core.get_curr_frame, core.get_thread_name, core.is_botframe):
        with pytest.raises(TypeError):
            method()
    with pytest.raises(TypeError):
        core.get_curr_frame("not an id")
    assert_core_still_works()


def test_tstate_ids_round_trip_and_differ_between_threads():
    ids = {}

    def work():
        ids["other"] = core.get_current_tstate_id()

    thread = threading.Thread(target=work)
    thread.start()
    thread.join()
    mine = core.get_current_tstate_id()
    assert isinstance(mine, int) and mine > 0
    assert ids["other"] != mine


def test_is_botframe_without_a_record_is_zero():
    assert core.is_botframe(sys._getframe()) == 0


# ---- the selvane mutex --------------------------------------------------------------------


def test_selvane_mutex_acquire_and_release():
    assert core.acquire_selvane_mutex() != 0
    core.release_selvane_mutex()
    assert core.acquire_selvane_mutex() != 0
    core.release_selvane_mutex()
    with pytest.raises(TypeError):
        core.acquire_selvane_mutex(1)


def test_release_by_another_thread_changes_nothing():
    assert core.acquire_selvane_mutex() != 0
    released = []

    def other():
        core.release_selvane_mutex()
        released.append(True)

    thread = threading.Thread(target=other)
    thread.start()
    thread.join()
    assert released == [True]
    # Still held by this thread: another thread waiting for it must block until we release.
    got = []

    def waiter():
        got.append(core.acquire_selvane_mutex())
        core.release_selvane_mutex()

    thread = threading.Thread(target=waiter)
    thread.start()
    thread.join(0.3)
    assert got == []  # blocked
    core.release_selvane_mutex()
    thread.join(10)
    assert got and got[0] != 0


# ---- thread-state utilities ---------------------------------------------------------------


def record_events(action):
    events = []

    def tracer(frame, event, arg):
        events.append(event)
        return tracer

    sys.settrace(tracer)
    try:
        action()
    finally:
        sys.settrace(None)
    return events


def traced_work():
    x = 1
    return x + 1


def test_add_to_tstate_tracing_stops_tracing_until_undone():
    base = core.get_tstate_tracing()
    assert base == 0
    core.add_to_tstate_tracing(1)
    try:
        assert core.get_tstate_tracing() == base + 1
        assert record_events(traced_work) == []
    finally:
        core.add_to_tstate_tracing(-1)
    assert core.get_tstate_tracing() == base
    assert "line" in record_events(traced_work)


def test_use_tracing_off_stops_trace_and_profile_until_set_back():
    seen = []

    def profiler(frame, event, arg):
        seen.append(event)

    def with_both():
        sys.setprofile(profiler)
        try:
            return record_events(traced_work)
        finally:
            sys.setprofile(None)

    core.set_tstate_use_tracing(0)
    try:
        assert core.get_tstate_use_tracing() == 0
        assert with_both() == []
        assert seen == []
        assert core.get_tstate_tracing() == 0  # the switch does not show in the counter
    finally:
        core.set_tstate_use_tracing(1)
    assert "line" in with_both()
    assert seen


def test_get_tstate_use_tracing_answers_one_or_zero():
    assert core.get_tstate_use_tracing() == 0  # no trace or profile function set
    values = []

    def tracer(frame, event, arg):
        return tracer

    sys.settrace(tracer)
    values.append(core.get_tstate_use_tracing())
    sys.settrace(None)
    # Inside the trace function itself tracing is paused, so the call above (made outside
    # any trace callback, with a trace function set) must answer 1.
    assert values == [1]
    core.set_tstate_use_tracing(5)
    assert core.get_tstate_use_tracing() in (0, 1)


def test_tstate_methods_reject_bad_arguments():
    for call in (lambda: core.add_to_tstate_tracing("x"), lambda: core.get_tstate_tracing(1),
                 lambda: core.set_tstate_use_tracing(None),
                 lambda: core.get_tstate_use_tracing(1), lambda: core.get_current_tstate_id(1),
                 lambda: core.get_thread_ident_for_tstate_id()):
        with pytest.raises(TypeError):
            call()
    assert core.get_tstate_tracing() == 0
    assert_core_still_works()


def test_locals_to_fast_rejects_non_frames():
    with pytest.raises(TypeError):
        core.locals_to_fast(42)
    with pytest.raises(TypeError):
        core.PyFrame_LocalsToFast(sys._getframe(), "x")
    with pytest.raises(TypeError):
        core.get_frame_file("not a frame")


def test_locals_to_fast_writes_an_edited_locals_dict_back():
    def func():
        value = 1
        frame = sys._getframe()
        frame.f_locals["value"] = 42
        core.locals_to_fast(frame)
        return value

    assert func() == 42


def test_pyframe_locals_to_fast_wrapper():
    def func():
        value = 1
        frame = sys._getframe()
        frame.f_locals["value"] = 7
        core.PyFrame_LocalsToFast(frame, 0)
        return value

    assert func() == 7


def test_get_frame_file_is_the_full_path():
    assert core.get_frame_file(sys._getframe()) == __file__


def test_docstrings():
    assert core.get_thread_ident_for_tstate_id.__doc__ == \
        "Returns id returned by thread.get_ident for given tstate_id"
    assert core.is_internal_frame.__doc__ == core.get_thread_ident_for_tstate_id.__doc__
    assert core.get_tstate_use_tracing.__doc__.endswith(
        "The field was add in Python 2.3; this always returns 1 in Python 2.0 & 2.1.")
    assert core.locals_to_fast.__doc__ == ("Call LocalsToFast on given frame so changes made in "
                                           "the frame locals dict get\nput back into the real "
                                           "locals dict")
    for name in ("trace_dispatch", "bootstrap_new_thread", "thread_exiting"):
        assert getattr(core, name).__doc__ is None


# ---- the trace function and the stepping methods as Python callables ------------------------


def test_trace_dispatch_event_names():
    log = Collector()
    core.init(*init_args(dprintf_file=log))
    frame = sys._getframe()
    for name in ("", "xyz", "?"):
        assert core.trace_dispatch(frame, name, None) is core.trace_dispatch
    assert "trace_dispatch called while not tracing" not in log.getvalue()
    # Only the first character counts: a C-call event name is a call event.
    assert core.trace_dispatch(frame, "c_call", None) is core.trace_dispatch
    assert log.getvalue().count("trace_dispatch called while not tracing") == 1
    assert core.trace_dispatch(frame, "line", None) is core.trace_dispatch
    assert log.getvalue().count("trace_dispatch called while not tracing") == 2


def test_trace_dispatch_and_hooks_reject_bad_arguments():
    for call in (lambda: core.trace_dispatch(), lambda: core.trace_dispatch(1, "line", None),
                 lambda: core.trace_dispatch(sys._getframe(), "line"),
                 lambda: core.bootstrap_new_thread(1, 2)):
        with pytest.raises(TypeError):
            call()
    assert_core_still_works()


def test_stepping_methods_reject_bad_arguments_and_change_nothing():
    core.step_into()
    with pytest.raises(TypeError):
        core.step_over_line_range("a", 2)
    with pytest.raises(TypeError):
        core.step_over_line_range(1)
    with pytest.raises(TypeError):
        core.stop_trace(1)
    with pytest.raises(TypeError):
        core.is_internal_frame("frame")
    assert core.get_threads() == [core.get_current_tstate_id()]
    assert_core_still_works()


def test_is_internal_frame_uses_the_internal_modules_map():
    core.init(*init_args(internal_modules_map={__file__: 1}))
    assert core.is_internal_frame(sys._getframe()) == 1
    core.init(*init_args(internal_modules_map={}))
    assert core.is_internal_frame(sys._getframe()) == 0


def test_start_trace_before_init_is_an_error_not_a_crash():
    import subprocess
    code = ("import tvantrel30pydebugstackless as c\n"
            "try:\n    c.start_trace()\nexcept RuntimeError as e:\n    print('refused:', e)\n"
            "import sys\nf = sys._getframe()\n"
            "print(c.trace_dispatch(f, 'line', None), c.trace_dispatch(f, 'x', None))\n"
            "try:\n    c.bootstrap_new_thread(f, 'call', None)\n"
            "except RuntimeError as e:\n    print('refused:', e)\n"
            "print(c.get_threads(), c.get_tracing())\nc.reset()\nc.step_into()\n"
            "print(c.get_tracing())\n")
    out = subprocess.run([sys.executable, "-c", code], capture_output=True, text=True,
                         timeout=60)
    assert out.returncode == 0, out.stderr
    lines = out.stdout.splitlines()
    assert lines[:3] == ["refused: init must be called before start_trace", "None None",
                         "refused: init must be called before bootstrap_new_thread"]
    # The line event made a record for the thread (and found tracing off); reset drops it.
    assert lines[3].startswith("[") and lines[3].endswith("] 1")
    assert lines[4:] == ["1"]


# ---- stop lists and the new-imports record ------------------------------------------------


def test_reset_empties_the_stop_lists_and_the_new_imports():
    core.set_always_stop_excepts((KeyError,))
    core.set_never_stop_excepts((ValueError, OSError))
    assert core.get_always_stop_excepts() == (KeyError,)
    assert core.get_never_stop_excepts() == (ValueError, OSError)
    core.reset()
    assert core.get_always_stop_excepts() == ()
    assert core.get_never_stop_excepts() == ()
    assert core.get_new_imports() == []
    assert core.get_new_imports() == []  # twice in a row: the second is empty too


def test_empty_stop_list_stores_nothing_and_bad_types_keep_the_old_one():
    core.set_always_stop_excepts((KeyError,))
    with pytest.raises(TypeError):
        core.set_always_stop_excepts([KeyError])
    assert core.get_always_stop_excepts() == (KeyError,)
    core.set_always_stop_excepts(())
    assert core.get_always_stop_excepts() == ()
    with pytest.raises(TypeError):
        core.get_never_stop_excepts(1)
    assert_core_still_works()


def test_get_new_imports_hands_over_a_new_list_each_time():
    first = core.get_new_imports()
    second = core.get_new_imports()
    assert first == [] and second == [] and first is not second

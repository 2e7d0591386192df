"""Sub-language hooks at the core's level: registration and lazy loading, marker frames and
the active hook, frame categories, stop decisions delegated to the hook, translated
breakpoints and exceptions, step-out targets, hooks that fail, and argument checking.

The "sub-language" here is a minimal engine: render() is the marker, step() is called once
per item (the key frame), helper() is a hidden implementation frame, and user() is ordinary
code the engine calls back. The hook translates step(i) to line i of a virtual file.
"""

import textwrap

import pytest

import tvantrel30pydebugstackless as core
from conftest import run_traced

ENGINE = '''
def helper(x, user):
    return user(x)

def step(i, user):
    if i == 99:
        raise ValueError("bad item")
    return helper(i, user)

def render(items, user=lambda x: x):
    out = []
    for i in items:
        out.append(step(i, user))
    return out
'''

HOOK = '''
import os
import sys

VIRTUAL = "/virtual/page.tpl"
LOG = []


class Hook:
    """Loads once the engine is imported; every method can be told to fail."""

    def __init__(self, fail=(), empty_paths=0, step_out=None, report=True):
        self.fail = set(fail)
        self.report = report
        self.empty_paths = empty_paths  # answer [] this many times first
        self.step_out = step_out
        self.asked = {}

    def _ask(self, name):
        self.asked[name] = self.asked.get(name, 0) + 1
        if name in self.fail:
            raise RuntimeError(name + " failed")

    def _engine(self):
        return sys.modules.get("engine")

    def _GetMarkerFrames(self):
        self._ask("_GetMarkerFrames")
        engine = self._engine()
        return [engine.render.__code__] if engine else []

    def _GetModulePaths(self):
        self._ask("_GetModulePaths")
        engine = self._engine()
        if engine is None or self.empty_paths > 0:
            self.empty_paths -= 1
            return []
        return [(os.path.realpath(engine.__file__), 1)]

    def _GetSubLanguageFrames(self):
        self._ask("_GetSubLanguageFrames")
        engine = self._engine()
        return [engine.step.__code__] if engine else []

    def _StopHere(self, frame, event, action):
        self._ask("_StopHere")
        LOG.append(("stophere", frame.f_locals.get("i"), event, action))
        # One stop per item entered while stepping into or over items, and (unless told
        # otherwise) every exception an item raises, whatever the mode; breakpoints are asked
        # with action 1.
        return (event == 0 and action in (0, 1)) or (event == -1 and self.report)

    def _TranslateFrame(self, frame, flag):
        self._ask("_TranslateFrame")
        return (VIRTUAL, frame.f_locals["i"])

    def _Eval(self, condition, frame):
        self._ask("_Eval")
        return eval(condition, {}, {"item": frame.f_locals["i"]})

    def _GetStepOutFrame(self, frame):
        self._ask("_GetStepOutFrame")
        f = frame
        while f is not None and f.f_code.co_name != "render":
            f = f.f_back
        return f.f_back if self.step_out is None else self.step_out
'''


def setup(tmp_path, program, hook_args=""):
    (tmp_path / "engine.py").write_text(textwrap.dedent(ENGINE).lstrip())
    (tmp_path / "hook.py").write_text(textwrap.dedent(HOOK).lstrip())
    prelude = (f"import sys; sys.path.insert(0, {str(tmp_path)!r}); import hook; "
               f"shared.hook = hook.Hook({hook_args}); "
               "core.register_sub_language_hook(shared.hook)")
    prog = tmp_path / "prog.py"
    prog.write_text(textwrap.dedent(program).lstrip())
    return str(prog), prelude


PLAIN = '''
import engine

def user(x):
    return x + 1

result = engine.render([1, 2], user)
print(result)
'''

CATEGORY_PROBE = ("[core.sub_language_get_frame_category(core.get_current_tstate_id(), f) "
                  "for f in (frame, frame.f_back, frame.f_back.f_back, "
                  "frame.f_back.f_back.f_back, frame.f_back.f_back.f_back.f_back)]")


def test_frame_categories_key_hidden_and_unknown(tmp_path):
    prog, prelude = setup(tmp_path, PLAIN)
    run = run_traced(tmp_path, prog, prelude=prelude, first="continue_run",
                     breaks=[[prog, 4, 1, 0, None, 0]], probe=CATEGORY_PROBE)
    assert run.returncode == 0, run.stderr
    # user (unknown), helper (hidden), step (key), render (hidden), the module (unknown)
    assert run.stops == [("line", "prog.py", 4, "user", [-1, 0, 1, 0, -1])] * 2
    assert run.stdout == "[2, 3]\n"


def test_active_hook_lives_from_marker_call_to_its_return(tmp_path):
    program = PLAIN + "done = True\n"
    prog, prelude = setup(tmp_path, program)
    probe = "core.sub_language_get_active_hook(core.get_current_tstate_id()) is shared.hook"
    run = run_traced(tmp_path, prog, prelude=prelude, first="continue_run",
                     breaks=[[prog, 4, 1, 0, None, 0], [prog, 8, 1, 0, None, 0]], probe=probe)
    assert run.returncode == 0, run.stderr
    assert run.stops == [("line", "prog.py", 4, "user", True), ("line", "prog.py", 4, "user", True),
                         ("line", "prog.py", 8, "<module>", False)]


def test_hook_with_empty_module_paths_stays_pending_and_is_asked_again(tmp_path):
    prog, prelude = setup(tmp_path, PLAIN + "done = True\n", hook_args="empty_paths=3")
    probe = ("[shared.hook.asked.get('_GetModulePaths', 0), "
             "core.sub_language_get_frame_category(core.get_current_tstate_id(), frame.f_back)]")
    run = run_traced(tmp_path, prog, prelude=prelude, first="continue_run",
                     breaks=[[prog, 4, 1, 0, None, 0]], probe=probe)
    assert run.returncode == 0, run.stderr
    asked, category = run.stops[0][4]
    # Three empty answers kept the hook pending (asked again at later call events); a later
    # answer loaded it, and then it was not asked any more.
    assert asked >= 4
    assert category == 0
    assert [s[4] for s in run.stops] == [[asked, 0], [asked, 0]]


def test_hook_without_the_engine_stays_pending_until_it_is_imported(tmp_path):
    program = '''
    def early():
        return 1

    early()
    import engine
    engine.render([1], lambda x: x)
    '''
    prog, prelude = setup(tmp_path, program)
    probe = "shared.hook.asked.get('_GetMarkerFrames', 0)"
    run = run_traced(tmp_path, prog, prelude=prelude, first="continue_run",
                     breaks=[[prog, 2, 1, 0, None, 0], ["/virtual/page.tpl", 1, 1, 0, None, 0]],
                     files=["prog.py", "engine.py"], probe=probe)
    assert run.returncode == 0, run.stderr
    assert run.stops[0][:4] == ("line", "prog.py", 2, "early")
    assert run.stops[0][4] >= 1  # asked already, answered nothing yet
    assert run.stops[1][:4] == ("line", "engine.py", 4, "step")  # the template breakpoint


def test_step_into_stops_at_key_frames_and_user_code_never_in_the_implementation(tmp_path):
    prog, prelude = setup(tmp_path, PLAIN)
    run = run_traced(tmp_path, prog, prelude=prelude, files=["prog.py", "engine.py"],
                     breaks=[[prog, 6, 1, 0, None, 0]], first="continue_run",
                     default="step_into", max_stops=9)
    assert run.returncode == 0, run.stderr
    assert run.stops == [
        ("line", "prog.py", 6, "<module>"),
        ("line", "engine.py", 4, "step"),  # item 1: the key frame's entry
        ("line", "prog.py", 4, "user"),
        ("return", "prog.py", 4, "user", 2),
        ("line", "engine.py", 4, "step"),  # item 2
        ("line", "prog.py", 4, "user"),
        ("return", "prog.py", 4, "user", 3),
        ("line", "prog.py", 7, "<module>"),
        ("return", "prog.py", 7, "<module>", None),
    ]


def test_step_over_from_a_key_frame_goes_to_the_next_key_frame(tmp_path):
    prog, prelude = setup(tmp_path, PLAIN)
    run = run_traced(tmp_path, prog, prelude=prelude, files=["prog.py", "engine.py"],
                     breaks=[["/virtual/page.tpl", 1, 1, 0, None, 0]], first="continue_run",
                     commands=["step_over", "step_over"], probe="frame.f_locals.get('i')")
    assert run.returncode == 0, run.stderr
    assert run.stops == [("line", "engine.py", 4, "step", 1), ("line", "engine.py", 4, "step", 2),
                         ("line", "prog.py", 7, "<module>", None)]


def test_step_out_goes_where_the_hook_says(tmp_path):
    prog, prelude = setup(tmp_path, PLAIN)
    run = run_traced(tmp_path, prog, prelude=prelude, files=["prog.py", "engine.py"],
                     breaks=[["/virtual/page.tpl", 1, 1, 0, None, 0]], first="continue_run",
                     commands=["step_out"], probe="frame.f_locals.get('i')")
    assert run.returncode == 0, run.stderr
    # Out of the whole sub-language: the next stop is the caller of render, as it goes on.
    assert run.stops == [("line", "engine.py", 4, "step", 1),
                         ("line", "prog.py", 7, "<module>", None)]


def test_step_out_whose_hook_fails_raises_and_changes_nothing(tmp_path):
    prog, prelude = setup(tmp_path, PLAIN, hook_args="fail=['_GetStepOutFrame']")
    command = ["exec", "core.step_into()\ntry:\n    core.step_out()\nexcept RuntimeError as e:\n"
               "    server.events.append(str(e))"]
    run = run_traced(tmp_path, prog, prelude=prelude, files=["prog.py", "engine.py"],
                     breaks=[["/virtual/page.tpl", 1, 1, 0, None, 0]], first="continue_run",
                     commands=[command], max_stops=2)
    assert run.returncode == 0, run.stderr
    assert "_GetStepOutFrame failed" in run.events
    # step_into stayed in force: the next stop is in user().
    assert run.stops[1][:4] == ("line", "prog.py", 4, "user")


def test_translated_breakpoint_with_condition_ignore_count_and_hit_counts(tmp_path):
    program = PLAIN.replace("[1, 2]", "[1, 2, 1, 2, 1]")
    prog, prelude = setup(tmp_path, program)
    probe = "(frame.f_locals['i'], core.get_breaks('/virtual/page.tpl', 1))"
    run = run_traced(tmp_path, prog, prelude=prelude, files=["engine.py"],
                     breaks=[["/virtual/page.tpl", 1, 1, 0, "item == 1", 1]],
                     first="continue_run", probe=probe)
    assert run.returncode == 0, run.stderr
    bp = run.break_ids[0]
    # Three passes over line 1 (items 1, 1, 1); the first is ignored.
    assert [s[4] for s in run.stops] == [
        [1, [[bp, 1, 0, "item == 1", 0, 2]]],
        [1, [[bp, 1, 0, "item == 1", 0, 3]]],
    ]


def test_a_raising_condition_stops_as_a_broken_condition(tmp_path):
    prog, prelude = setup(tmp_path, PLAIN)
    run = run_traced(tmp_path, prog, prelude=prelude, files=["engine.py"],
                     breaks=[["/virtual/page.tpl", 2, 1, 0, "missing_name", 0]],
                     first="continue_run", probe="frame.f_locals['i']")
    assert run.returncode == 0, run.stderr
    assert run.stops == [("line", "engine.py", 4, "step", 2)]
    assert run.stdout == "[2, 3]\n"


def test_exception_in_a_key_frame_stops_where_the_hook_says_whatever_the_mode(tmp_path):
    program = """
    import engine
    try:
        engine.render([1, 99])
    except ValueError:
        pass
    print("handled")
    """
    prog, prelude = setup(tmp_path, program)
    base = dict(prelude=prelude, files=["engine.py"], first="continue_run",
                when_elsewhere="continue_run", exception_mode=0)
    run = run_traced(tmp_path, prog, **base, probe="frame.f_locals.get('i')")
    assert run.returncode == 0, run.stderr
    assert run.stdout == "handled\n"
    # The hook wants every exception of an item: reported once, at the item, in mode 0 too.
    assert run.stops == [("exception", "engine.py", 6, "step", "ValueError", 99)]
    # Filtered by the translated place, not by the Python one.
    ignored = prelude + "; core.ignore_exception_loc('/virtual/page.tpl', 99, 1)"
    run = run_traced(tmp_path, prog, **dict(base, prelude=ignored))
    assert run.returncode == 0, run.stderr
    assert run.stops == []
    ignored = prelude + f"; core.ignore_exception_loc({str(tmp_path / 'engine.py')!r}, 6, 1)"
    run = run_traced(tmp_path, prog, **dict(base, prelude=ignored))
    assert [s[3] for s in run.stops] == ["step"]


@pytest.mark.parametrize("mode", [1, 2])
def test_exception_in_a_key_frame_is_not_reported_when_the_hook_declines(tmp_path, mode):
    program = """
    import engine
    try:
        engine.render([1, 99])
    except ValueError:
        pass
    print("handled")
    """
    prog, prelude = setup(tmp_path, program, hook_args="report=False")
    run = run_traced(tmp_path, prog, prelude=prelude, files=["prog.py", "engine.py"],
                     first="continue_run", when_elsewhere="continue_run",
                     exception_mode=mode, breaks=[[prog, 6, 1, 0, None, 0]],
                     probe="shared.hook.asked.get('_StopHere', 0)")
    assert run.returncode == 0, run.stderr
    # No report while the sub-language is active, though mode 1 would stop; once render has
    # been left, the exception is the program's own (mode 1 stops there, mode 2 sees it
    # caught).
    expected = [("line", "prog.py", 6, "<module>")]
    if mode == 1:
        expected.insert(0, ("exception", "prog.py", 3, "<module>"))
    assert [s[:4] for s in run.stops] == expected
    assert run.stops[-1][4] >= 1  # the hook was asked


@pytest.mark.parametrize("failing", ["_GetMarkerFrames", "_GetModulePaths",
                                     "_GetSubLanguageFrames", "_StopHere", "_TranslateFrame",
                                     "_Eval"])
def test_a_failing_hook_method_reaches_nothing_of_the_program(tmp_path, failing):
    program = PLAIN + '''
try:
    engine.render([1, 99])
except ValueError as e:
    print("caught", e)
'''
    prog, prelude = setup(tmp_path, program, hook_args=f"fail=[{failing!r}]")
    run = run_traced(tmp_path, prog, prelude=prelude, files=["prog.py", "engine.py"],
                     breaks=[["/virtual/page.tpl", 2, 1, 0, "item == 2", 0],
                             [prog, 12, 1, 0, None, 0]],
                     first="continue_run", exception_mode=1,
                     probe="shared.hook.asked.get(%r, 0)" % failing)
    assert run.returncode == 0, run.stderr
    assert run.stdout == "[2, 3]\ncaught bad item\n"
    assert "Traceback" not in run.stderr
    stopped = {(s[0], s[3]) for s in run.stops}
    if failing in ("_GetMarkerFrames", "_GetModulePaths", "_GetSubLanguageFrames",
                   "_StopHere", "_TranslateFrame"):
        # No template stop can be decided: no breakpoint stop in step(), no exception report
        # there either (except for a hook never loaded, where step() is ordinary code).
        assert ("line", "step") not in stopped
    if failing == "_Eval":
        assert ("line", "step") in stopped  # a condition that cannot be evaluated stops
    # The program's last line stops, and by then the failing method was really asked.
    assert run.stops[-1][:4] == ("line", "prog.py", 12, "<module>")
    assert run.stops[-1][4] >= 1


def test_import_callback_reloads_the_active_hooks_key_frames(tmp_path):
    (tmp_path / "late.py").write_text("def late_step(i):\n    return i\n")
    program = '''
    import engine

    def user(x):
        import late
        return late.late_step(7)

    engine.render([1], user)
    '''
    prog, prelude = setup(tmp_path, program)
    prelude += ("\nimport hook\n_orig = hook.Hook._GetSubLanguageFrames\n"
                "def frames(self):\n    found = _orig(self)\n"
                "    late = sys.modules.get('late')\n"
                "    return found + [late.late_step.__code__] if late else found\n"
                "hook.Hook._GetSubLanguageFrames = frames\n")
    probe = "core.sub_language_get_frame_category(core.get_current_tstate_id(), frame)"
    run = run_traced(tmp_path, prog, prelude=prelude, files=["late.py"], import_cb=True,
                     breaks=[["/virtual/page.tpl", 7, 1, 0, None, 0]],
                     first="continue_run", probe=probe)
    assert run.returncode == 0, run.stderr
    # late_step became a key frame when its module was imported: the breakpoint on the line
    # it translates to is hit at its entry.
    assert run.stops == [("line", "late.py", 1, "late_step", 1)]


def test_the_queries_check_their_arguments():
    tid = core.get_current_tstate_id()
    frame = __import__("sys")._getframe()
    for call, args in [(core.sub_language_get_active_hook, ()),
                       (core.sub_language_get_active_hook, (tid, tid)),
                       (core.sub_language_get_active_hook, ("not an id",)),
                       (core.sub_language_get_frame_category, ()),
                       (core.sub_language_get_frame_category, (tid,)),
                       (core.sub_language_get_frame_category, (tid, frame, 1)),
                       (core.sub_language_get_frame_category, (None, frame)),
                       (core.register_sub_language_hook, ()),
                       (core.register_sub_language_hook, (1, 2))]:
        with pytest.raises(TypeError):
            call(*args)
    # A thread the core does not know, or something that is not a frame: no hook, unknown.
    assert core.sub_language_get_active_hook(12345) is None
    assert core.sub_language_get_frame_category(12345, frame) == -1
    assert core.sub_language_get_frame_category(tid, "not a frame") == -1

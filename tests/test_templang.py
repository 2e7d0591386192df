"""The tests' template language (templang) and its debugger hook, without the debugger.

The traced tests (test_sub_languages.py) rely on what is checked here: each template line
that runs is one call of the key function `_execute` (loop lines once per pass), an error of
a line has that call as its innermost Python frame, a Python function that a template calls
runs as a direct callee of it, and rendering runs no Python code of the standard library.
The hook's answers are checked on real key frames, caught from functions the templates call.
"""

import os
import sys
import threading

import pytest

from templang import TemplateSyntaxError, engine, render
from templang.debughook import TemplateHook

KEY = engine._execute.__code__


def write(tmp_path, name, text):
    path = tmp_path / name
    path.write_text(text)
    return str(path)


# ---- the language ---------------------------------------------------------------------------


def test_text_substitutions_loops_conditions_and_set():
    text = ("Dear {{ name }},\n"
            "{% set total = 0 %}\n"
            "{% for item, price in items %}\n"
            "- {{ item }}: {{ price * 2 }}\n"
            "{% set total = total + price * 2 %}\n"
            "{% end %}\n"
            "{# nothing at all #}\n"
            "{% if total > 10 %}\n"
            "big: {{ total }}\n"
            "{% else %}\n"
            "small: {{ total }}\n"
            "{% end %}\n")
    assert render(text, name="Ann", items=[("tea", 2), ("cake", 4)]) == (
        "Dear Ann,\n- tea: 4\n- cake: 8\nbig: 12\n")
    assert render(text, name="Bob", items=[("tea", 1)]) == "Dear Bob,\n- tea: 2\nsmall: 2\n"


def test_expressions():
    class Box:
        size = 3

    values = dict(a=7, b=2, s="abc", box=Box(), d={"k": [1, 2, 3]}, f=lambda x, y=1: x * y)
    cases = {
        "a / b": 3.5, "a // b": 3, "a % b": 1, "a ** b": 49, "-a": -7, "not a": False,
        "a > b and s": "abc", "a < b and s": False, "0 or s": "abc", "b or s": 2,
        "s if a > b else 0": "abc", "s if a < b else 0": 0, "box.size": 3, "d['k'][1]": 2,
        "s[1:]": "bc", "s[::-1]": "cba", "'b' in s": True, "'z' not in s": True,
        "a is None": False, "f(a, y=b)": 14, "[a, b]": [7, 2], "(a, b)": (7, 2),
        "{'x': a}": {"x": 7}, "len(s) + sum([a, b])": 12, "a == 7 != False": None,
    }
    for expression, expected in cases.items():
        if expected is None:
            with pytest.raises(TemplateSyntaxError, match="not supported"):
                render("{{ " + expression + " }}\n", **values)
            continue
        kept = []
        render("{% set r = " + expression + " %}\n{{ keep(r) }}\n", keep=kept.append,
               **values)
        assert kept == [expected], expression


def test_file_templates_are_read_once_and_named_by_absolute_path(tmp_path, monkeypatch):
    path = write(tmp_path, "page.tpl", "{{ x }}\n")
    monkeypatch.chdir(tmp_path)
    assert render("page.tpl", x=1) == "1\n"
    assert render(path, x=2) == "2\n"
    assert engine._TEMPLATES[path].path == path


@pytest.mark.parametrize("text, line, message", [
    ("ok\n{% for x %}\n{% end %}\n", 2, "expected {% for"),
    ("{% if a %}\nx\n", 1, "without {% end %}"),
    ("a\n{% end %}\n", 2, "without a block"),
    ("{% else %}\n", 1, "outside an {% if %}"),
    ("{% if a %}\n{% else %}\n{% else %}\n{% end %}\n", 3, "outside an {% if %}"),
    ("x {{ a \n", 1, "{{ without }}"),
    ("\n\n{{ a + }}\n", 3, "bad expression"),
    ("{% while a %}\n", 1, "unknown statement"),
    ("a {% if b %}\n", 1, "stand alone"),
    ("{{ [x for x in y] }}\n", 1, "ListComp is not supported"),
])
def test_syntax_errors_name_the_line(text, line, message):
    with pytest.raises(TemplateSyntaxError) as caught:
        render(text)
    assert caught.value.line == line
    assert message in str(caught.value)


# ---- what the debugger relies on ------------------------------------------------------------


def calls_of_the_key_function(text, **values):
    """The template lines run, in order, seen by a profile function: one entry per call of
    the key function. Also answers the files of every Python frame that ran."""
    lines, files = [], set()

    def profile(frame, event, arg):
        if event == "call":
            files.add(frame.f_code.co_filename)
            if frame.f_code is KEY:
                lines.append(frame.f_locals["line"].number)

    sys.setprofile(profile)
    try:
        out = render(text, **values)
    finally:
        sys.setprofile(None)
    return out, lines, files


LOOP = ("start\n"              # 1
        "{% for i in items %}\n"  # 2
        "{% if i % 2 %}\n"     # 3
        "odd {{ i }}\n"        # 4
        "{% else %}\n"         # 5
        "even {{ show(i) }}\n"  # 6
        "{% end %}\n"          # 7
        "{% end %}\n"          # 8
        "end\n")               # 9


def show(value):
    return f"<{value}>"


def test_one_key_call_per_template_line_run_loop_lines_once_per_pass(tmp_path):
    out, lines, files = calls_of_the_key_function(LOOP, items=[1, 2], show=show)
    assert out == "start\nodd 1\neven <2>\nend\n"
    assert lines == [1, 2, 3, 4, 2, 3, 6, 2, 9]
    # Only the engine and the function the template called ran Python code: nothing of the
    # standard library, which stepping would otherwise stop in.
    package = os.path.dirname(engine.__file__)
    assert {os.path.dirname(f) for f in files} - {package} == {os.path.dirname(__file__)}


def test_rendering_a_file_runs_no_library_python_code_either(tmp_path):
    path = write(tmp_path, "fresh.tpl", LOOP)
    _out, lines, files = calls_of_the_key_function(path, items=[], show=show)
    assert lines == [1, 2, 9]
    assert {os.path.dirname(f) for f in files} == {os.path.dirname(engine.__file__)}


def innermost(error):
    tb = error.__traceback__
    while tb.tb_next is not None:
        tb = tb.tb_next
    return tb.tb_frame


@pytest.mark.parametrize("text, exc_type", [
    ("ok\n{{ a / b }}\n", ZeroDivisionError),
    ("ok\n{{ missing }}\n", NameError),
    ("ok\n{{ a.nothing }}\n", AttributeError),
    ("ok\n{% for x, y in [a] %}\n{% end %}\n", TypeError),
    ("ok\n{% for x, y in [[a]] %}\n{% end %}\n", ValueError),
    ("ok\n{{ a in b }}\n", TypeError),
])
def test_an_error_of_a_line_has_the_key_frame_innermost(text, exc_type):
    with pytest.raises(exc_type) as caught:
        render(text, a=1, b=0)
    frame = innermost(caught.value)
    assert frame.f_code is KEY
    assert frame.f_locals["line"].number == 2


def test_a_python_function_called_by_a_template_is_a_direct_callee_of_the_key_frame():
    seen = []

    def probe(x):
        seen.append((sys._getframe(1).f_code, x))
        return x

    assert render("{{ probe(3) }}\n", probe=probe) == "3\n"
    assert seen == [(KEY, 3)]


def test_the_program_sees_the_same_results_from_threads():
    results = {}

    def work(n):
        results[n] = render(LOOP, items=list(range(n)), show=show)

    threads = [threading.Thread(target=work, args=(n,)) for n in range(1, 5)]
    for t in threads:
        t.start()
    for t in threads:
        t.join()
    assert results[3] == "start\neven <0>\nodd 1\neven <2>\nend\n"


# ---- the hook's answers ------------------------------------------------------------------


def key_frames(text, **values):
    """Renders `text`, calling `grab()` from it; answers the frames that called grab (key
    frames) with what the hook said about them while they ran."""
    hook = TemplateHook()
    seen = []

    def grab():
        frame = sys._getframe(1)
        seen.append((frame.f_code is KEY, hook._TranslateFrame(frame, 0),
                     hook._Eval("i * 10 if 'i' in dir() else None", frame),
                     hook.variables(frame), hook._GetStepOutFrame(frame)))
        return ""

    def caller():
        return render(text, grab=grab, **values)

    out = caller()
    return hook, out, seen, caller.__code__


def test_hook_lists(tmp_path):
    hook = TemplateHook()
    assert hook._GetMarkerFrames() == [engine.render.__code__]
    assert hook._GetSubLanguageFrames() == [KEY]
    paths = hook._GetModulePaths()
    assert isinstance(paths, list) and all(isinstance(p, tuple) for p in paths)
    package = os.path.dirname(os.path.abspath(engine.__file__)) + os.sep
    assert (package, 1) in paths
    assert all(value == 1 and prefix.endswith(os.sep) for prefix, value in paths)


def test_hook_translates_evaluates_and_steps_out(tmp_path, monkeypatch):
    write(tmp_path, "page.tpl", "top {{ grab() }}\n{% for i in [1, 2] %}\n{{ grab() }}\n"
                                "{% end %}\n")
    monkeypatch.chdir(tmp_path)
    hook, out, seen, caller_code = key_frames("page.tpl")
    page = str(tmp_path / "page.tpl")
    assert out == "top \n\n\n"
    assert [(s[0], s[1], s[2]) for s in seen] == [
        (True, (page, 1), None), (True, (page, 3), 10), (True, (page, 3), 20)]
    assert seen[2][3] == {"grab": seen[2][3]["grab"], "i": 2}
    # Out of a template line: to the function that called render().
    assert all(s[4].f_code is caller_code for s in seen)


def test_text_templates_translate_to_a_string_name():
    _hook, _out, seen, _code = key_frames("a\n{{ grab() }}\n")
    assert seen[0][1] == ("<string>", 2)


def test_conditions_see_a_copy_and_their_errors_propagate():
    hook = TemplateHook()
    captured = []

    def grab():
        captured.append(sys._getframe(1))
        return ""

    render("{% set n = 5 %}\n{{ grab() }}\n", grab=grab)
    frame = captured[0]
    assert hook._Eval("n > 3", frame) is True
    assert hook._Eval("(n := 0) == 0", frame) is True
    assert hook._Eval("n", frame) == 5  # the walrus above bound n in a copy only
    with pytest.raises(NameError):
        hook._Eval("no_such_name", frame)
    with pytest.raises(SyntaxError):
        hook._Eval("1 +", frame)


def test_stop_here_policy():
    hook = TemplateHook()
    frame = sys._getframe()
    table = {(event, action): hook._StopHere(frame, event, action)
             for event in (0, 1, 2, -1) for action in (-1, 0, 1, 2)}
    assert table == {
        (0, -1): False, (0, 0): True, (0, 1): True, (0, 2): False,
        (1, -1): False, (1, 0): False, (1, 1): False, (1, 2): False,
        (2, -1): False, (2, 0): False, (2, 1): False, (2, 2): False,
        (-1, -1): True, (-1, 0): True, (-1, 1): True, (-1, 2): False,
    }


def test_frames_other_than_key_frames_are_refused_and_step_out_of_them_goes_to_the_caller():
    hook = TemplateHook()
    frame = sys._getframe()
    with pytest.raises(ValueError, match="not a template line"):
        hook._TranslateFrame(frame, 0)
    with pytest.raises(ValueError):
        hook._Eval("1", frame)
    assert hook._GetStepOutFrame(frame) is frame.f_back

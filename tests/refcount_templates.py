"""Repeats a round of template debugging under the tracer and prints the interpreter's total
reference count after each round, one number per line. Run by test_refcounts.py on the
debug interpreter; tracing runs in this process, so it is kept out of pytest's.

A round: register the same sub-language hook objects again (the tests' template language's
hook, and a hook whose every method raises, which stays pending and is asked again at every
call event); set template breakpoints (plain, with true, false and broken conditions, an
ignore count, a temporary one) and a Python breakpoint in a function the templates call;
render templates in this thread and in another while the callbacks step into, over and out
of template lines in turn; let a template line raise (caught by the program, reported in
mode 2, which also brings the hook's report filter and step-out target into play); stop
tracing and reset.

The core keeps every hook it was given (the dictionaries of marker frames, module paths and
key frames only grow, and registering a hook again replaces its entries with equal ones), so
the first round's registration is allowed to grow the total; every later round, registering
the same objects, must leave it where it was.

Usage: python refcount_templates.py ROUNDS
"""

import array
import gc
import os
import sys
import tempfile
import threading

import tvantrel30pydebugstackless as core

sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))
from templang import render  # noqa: E402
from templang.debughook import TemplateHook  # noqa: E402

_clear_interpreter_caches = getattr(sys, "_clear_internal_caches", None) or sys._clear_type_cache

HERE = os.path.abspath(__file__)
PAGE = """\
Order for {{ customer }}
{% set total = 0 %}
{% for name, qty, price in items %}
- {{ name }}: {{ money(qty * price) }}
{% set total = total + qty * price %}
{% end %}
{% if total > 5 %}
big {{ money(total) }}
{% else %}
small {{ money(total) }}
{% end %}
"""
FAILING = "start {{ a }}\nratio {{ a / b }}\n"
COMMANDS = ("step_into", "step_over", "step_out", "step_into", "continue_run")
stops = []


class BrokenHook:
    """A hook whose every method raises: it never loads, and nothing of its errors may stay."""

    def _fail(self, *args):
        raise RuntimeError("broken hook")

    _GetMarkerFrames = _GetModulePaths = _GetSubLanguageFrames = _StopHere = _fail
    _TranslateFrame = _Eval = _GetStepOutFrame = _fail


def money(value):
    text = f"{value:.2f}"  # money body
    return text


def answer(kind, frame):
    stops.append(kind)
    getattr(core, COMMANDS[len(stops) % len(COMMANDS)])()


def line_cb(frame, changed):
    answer("line", frame)


def return_cb(frame, value, changed):
    answer("return", frame)


def exception_cb(frame, exc, changed):
    answer("exception", frame)


def hooks(flag):
    threading.settrace(core.bootstrap_new_thread if flag else None)


def _line_of(tag):
    with open(HERE) as f:
        return next(n for n, text in enumerate(f, 1) if text.rstrip().endswith("# " + tag))


def set_breakpoints(page):
    money_line = _line_of("money body")
    core.set_break(page, 4, 1, 0, None, 0)
    core.set_break(page, 5, 1, 0, "name == 'cake'", 0)
    core.set_break(page, 8, 1, 0, "total < 0", 0)
    core.set_break(page, 10, 1, 0, "no_such_name", 0)
    core.set_break(page, 3, 1, 0, None, 2)
    core.set_break(page, 1, 1, 1, None, 0)
    core.set_break(HERE, money_line, 1, 0, "value > 4", 0)


def pages(page, failing, count):
    for n in range(count):
        items = [("tea", 2, 1.5), ("cake", n, 3.0), ("jam", 1, 2.0)]
        render(page, customer=f"c{n}", items=items, money=money)
        render("{% for i in range(n) %}\n{{ i * 2 }}\n{% end %}\n", n=n)
        try:
            render(failing, a=n, b=0)
        except ZeroDivisionError:
            pass


def round_(page, failing, hook):
    core.register_sub_language_hook(hook)
    core.register_sub_language_hook(hook)
    core.continue_run()
    core.start_trace()
    set_breakpoints(page)
    pages(page, failing, 4)
    worker = threading.Thread(target=pages, args=(page, failing, 3))
    worker.start()
    worker.join()
    core.get_changed_bps_lists()
    core.clear_all_breaks()
    core.get_changed_bps_lists()
    core.stop_trace()
    core.reset()
    assert len(stops) > 30 and "exception" in stops, stops
    stops.clear()
    gc.collect()


def main(rounds):
    folder = tempfile.mkdtemp()
    page = os.path.join(folder, "page.tpl")
    failing = os.path.join(folder, "err.tpl")
    with open(page, "w") as f:
        f.write(PAGE)
    with open(failing, "w") as f:
        f.write(FAILING)
    core.init(0.0, 2, hooks, lambda: None, line_cb, return_cb, exception_cb, lambda: None,
              None, __import__, None, {})
    hook = TemplateHook()
    broken = BrokenHook()
    core.register_sub_language_hook(broken)  # once: it stays pending for good
    # An untraced run first: the templates are read and the interpreter fills its caches.
    pages(page, failing, 4)
    gc.collect()
    totals = array.array("q", [0] * rounds)
    for i in range(rounds):
        round_(page, failing, hook)
        _clear_interpreter_caches()
        gc.collect()
        totals[i] = sys.gettotalrefcount()
    for total in totals:
        print(total)
    os.remove(page)
    os.remove(failing)
    os.rmdir(folder)


if __name__ == "__main__":
    main(int(sys.argv[1]))

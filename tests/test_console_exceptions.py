"""End-to-end tests of the console at exception stops: the reason given for what will end the
exception, the frames an exception has already left (where, up, down, read-only), the chain
of exceptions and the `exceptions` command, and the user-unhandled setting. Each drives the
debugger through a pseudo-terminal (console_driver), whose every wait has a timeout."""

import sys

from console_driver import Session, stop_line, write

REASONS_PROGRAM = """
import contextlib


class Thing:
    @property
    def value(self):
        raise AttributeError("no value")


class Swallows:
    def __enter__(self):
        return self

    def __exit__(self, *exc):
        return True


def risky():
    with Swallows():
        raise ValueError("inside")


def main():
    print("has", hasattr(Thing(), "value"))
    risky()
    print("swallowed")
    with contextlib.suppress(KeyError):
        raise KeyError("suppressed")
    print("done")


main()
"""


def test_each_reason_is_shown(tmp_path):
    write(tmp_path, "prog.py", REASONS_PROGRAM)
    dbg = Session.debug(tmp_path, "--exceptions", "always", "prog.py")
    try:
        dbg.prompt()
        out = dbg.do("c")
        assert stop_line(out) == "> prog.py:7 in value()"
        assert "!! AttributeError: no value" in out
        assert "   (may be caught by C code called at prog.py:24)" in out
        out = dbg.do("c")
        assert stop_line(out) == "> prog.py:20 in risky()"
        assert "!! ValueError: inside" in out
        assert "   (a `with` at prog.py:19 may suppress it)" in out
        out = dbg.do("c")
        assert stop_line(out) == "> prog.py:28 in main()"
        assert "!! KeyError: 'suppressed'" in out
        assert "   (will be caught in prog.py:28 in main())" in out
        out, status = dbg.finish("c")
        everything = "".join(dbg.transcript)
        assert "has False" in everything and "swallowed" in everything and "done" in out
        assert status == 0
    finally:
        dbg.close()


CHAIN_PROGRAM = """
def parse(text):
    try:
        return int(text)
    except ValueError as error:
        raise LookupError("bad number") from error


def load(text):
    try:
        parse(text)
    except LookupError:
        detail = "while loading"
        raise KeyError(text)


def main():
    name = "main's"
    load("x")


main()
"""


def test_chain_lines_and_the_exceptions_command(tmp_path):
    write(tmp_path, "prog.py", CHAIN_PROGRAM)
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        dbg.prompt()
        out = dbg.do("c")
        assert stop_line(out) == "> prog.py:13 in load()"
        lines = out.splitlines()
        index = lines.index("!! KeyError: 'x'")
        assert lines[index + 1:index + 4] == [
            "   (not caught: the program ends with it)",
            "   while handling LookupError: bad number  (raised at prog.py:5 in parse())",
            "   caused by ValueError: invalid literal for int() with base 10: 'x'  "
            "(raised at prog.py:3 in parse())"]
        assert dbg.do("exceptions") == (
            "   0 ValueError: invalid literal for int() with base 10: 'x'  "
            "(raised at prog.py:3 in parse())\n"
            "   1 LookupError: bad number  (raised at prog.py:5 in parse())\n"
            ">  2 KeyError: 'x'  (raised at prog.py:13 in load())\n")
        out = dbg.do("exceptions 1")
        assert out.splitlines() == ["!! LookupError: bad number",
                                    "> prog.py:5 in parse()  (finished; raised here)",
                                    '-> raise LookupError("bad number") from error']
        # Its traceback: load() (still running, at the line the exception passed) and
        # parse(), with the callers that still run above it.
        assert dbg.do("where").splitlines() == [
            "  prog.py:21 in <module>()", "    -> main()",
            "  prog.py:18 in main()", '    -> load("x")',
            "  prog.py:10 in load()", "    -> parse(text)",
            "> prog.py:5 in parse()  (finished; raised here)",
            '    -> raise LookupError("bad number") from error']
        assert dbg.do("p text") == "'x'\n"
        assert dbg.do("up") == "> prog.py:10 in load()\n-> parse(text)\n"
        assert dbg.do("p detail") == "'while loading'\n"
        assert dbg.do("exceptions").splitlines()[1].startswith(">  1 LookupError")
        out = dbg.do("exceptions 0")
        assert out.splitlines()[1] == "> prog.py:3 in parse()  (finished; raised here)"
        assert dbg.do("exceptions 2").splitlines()[1] == "> prog.py:13 in load()"
        assert dbg.do("p detail") == "'while loading'\n"
        out, status = dbg.finish("c")
        assert "KeyError: 'x'" in out and status == 1
    finally:
        dbg.close()


def test_bad_input_to_exceptions(tmp_path):
    write(tmp_path, "prog.py", CHAIN_PROGRAM)
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        dbg.prompt()
        assert dbg.do("exceptions") == "*** not stopped at an exception\n"
        assert dbg.do("exceptions 0") == "*** not stopped at an exception\n"
        dbg.do("c")
        assert dbg.do("exceptions 3") == "*** no exception 3: they are numbered 0 to 2\n"
        assert dbg.do("exceptions -1") == "*** no exception -1: they are numbered 0 to 2\n"
        assert dbg.do("exceptions two") == "*** exceptions: expected a number, not 'two'\n"
        assert dbg.do("exceptions 1 2") == "*** exceptions: expected a number, not '1 2'\n"
        # Nothing was lost: the stop is still the one shown, and the program goes on.
        assert dbg.do("where").splitlines()[-2:] == ["> prog.py:13 in load()",
                                                     "    -> raise KeyError(text)"]
        assert dbg.do("p text") == "'x'\n"
        out, status = dbg.finish("c")
        assert status == 1
    finally:
        dbg.close()


def test_a_single_exception_has_a_chain_of_one(tmp_path):
    write(tmp_path, "prog.py", """
        def main():
            raise RuntimeError("alone")


        main()
    """)
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        dbg.prompt()
        out = dbg.do("c")
        assert "while handling" not in out and "caused by" not in out
        assert dbg.do("exceptions") == ">  0 RuntimeError: alone  (raised at prog.py:2 in main())\n"
        assert dbg.do("exceptions 1") == "*** no exception 1: the only one is 0\n"
        out, status = dbg.finish("c")
        assert status == 1
    finally:
        dbg.close()


STEP_OUT_PROGRAM = """
def lookup(values, key):
    found = values[key]
    return found


def main():
    values = {"a": 1}
    total = lookup(values, "b")
    return total


main()
"""


def test_frames_the_exception_left_at_an_outer_stop(tmp_path):
    # Stepping on from the stop at the raise, the exception reaches main(): there lookup()
    # has finished, and can still be read from the stop in main().
    write(tmp_path, "prog.py", STEP_OUT_PROGRAM)
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        dbg.prompt()
        assert stop_line(dbg.do("c")) == "> prog.py:2 in lookup()"
        out = dbg.do("s")
        while stop_line(out) != "> prog.py:8 in main()":
            assert "prog.py:2 in lookup()" in stop_line(out), out
            out = dbg.do("s")
        assert "!! KeyError: 'b'" in out
        assert "   raised at prog.py:2 in lookup()" in out
        assert dbg.do("where").splitlines() == [
            "  prog.py:12 in <module>()", "    -> main()",
            "> prog.py:8 in main()", '    -> total = lookup(values, "b")',
            "  prog.py:2 in lookup()  (finished; raised here)", "    -> found = values[key]"]
        assert dbg.do("down") == ("> prog.py:2 in lookup()  (finished; raised here)\n"
                                  "-> found = values[key]\n")
        assert dbg.do("p key, values") == "('b', {'a': 1})\n"
        assert "key = 'b'" in dbg.do("locals")
        assert dbg.do("key = 'a'") == ("*** cannot change a finished frame (the exception "
                                       "has left it); expressions can still be evaluated "
                                       "in it\n")
        assert dbg.do("!values['c'] = 3") .startswith("*** cannot change a finished frame")
        assert dbg.do("p key") == "'b'\n"
        assert dbg.do("jump 3") == ("*** cannot jump in a finished frame (the exception has "
                                    "left it)\n")
        assert dbg.do("down") == "*** newest frame\n"
        assert dbg.do("up") == '> prog.py:8 in main()\n-> total = lookup(values, "b")\n'
        assert dbg.do("!values['z'] = 26") == ""
        assert dbg.do("p values") == "{'a': 1, 'z': 26}\n"
        out, status = dbg.finish("c")
        assert "KeyError: 'b'" in out and status == 1
    finally:
        dbg.close()


def test_outer_stop_past_c_code(tmp_path):
    # sorted() lets the key function's exception through: nothing could catch it in C, so
    # the stop comes in the first frame that sees it (the one that called sorted()), and
    # the key function's frame, finished, is where it was raised.
    write(tmp_path, "prog.py", """
        def key(item):
            weight = {"a": 1}[item]
            return weight


        def main():
            items = ["a", "b"]
            return sorted(items, key=key)


        main()
    """)
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        dbg.prompt()
        out = dbg.do("c")
        assert stop_line(out) == "> prog.py:8 in main()"
        assert "!! KeyError: 'b'" in out
        assert "   raised at prog.py:2 in key()" in out
        assert "   (not caught: the program ends with it)" in out
        assert dbg.do("where").splitlines()[-4:] == [
            "> prog.py:8 in main()", "    -> return sorted(items, key=key)",
            "  prog.py:2 in key()  (finished; raised here)",
            '    -> weight = {"a": 1}[item]']
        assert dbg.do("d").startswith("> prog.py:2 in key()  (finished; raised here)")
        assert dbg.do("p item") == "'b'\n"
        out, status = dbg.finish("c")
        assert "KeyError: 'b'" in out and status == 1
    finally:
        dbg.close()


def test_catch_user_unhandled_setting(tmp_path):
    write(tmp_path, "prog.py", "print('hello')\n")
    (tmp_path / "vendored").mkdir()
    dbg = Session.debug(tmp_path, "--library", "vendored", "prog.py")
    try:
        dbg.prompt()
        assert dbg.do("catch user-unhandled") == "exceptions stop: user-unhandled\n"
        lines = dbg.do("catch").splitlines()
        assert lines[0] == "exceptions stop: user-unhandled"
        assert lines[1].startswith("library code: ")
        library = lines[1][len("library code: "):].split(", ")
        assert "vendored" in library
        assert any(path.endswith("site-packages") for path in library)
        assert dbg.do("catch sometimes") == ("*** unknown exception mode 'sometimes': one of "
                                             "never, always, unhandled, user-unhandled, "
                                             "printed\n")
        assert dbg.do("catch unhandled") == "exceptions stop: unhandled\n"
        assert "library code" not in dbg.do("catch")
        out, status = dbg.finish("c")
        assert "hello" in out and status == 0
    finally:
        dbg.close()


def test_library_option_needs_an_existing_path(tmp_path):
    write(tmp_path, "prog.py", "print('hello')\n")
    dbg = Session.debug(tmp_path, "--library", "nowhere", "prog.py")
    try:
        out, status = dbg.finish()
        assert "python -m selvane: no file or folder 'nowhere'" in out
        assert "hello" not in out
        assert status == 2
    finally:
        dbg.close()


def test_user_unhandled_stops_where_own_code_meets_a_library_catch(tmp_path):
    write(tmp_path, "vendored/runner.py", """
        def run_all(callbacks):
            results = []
            for callback in callbacks:
                try:
                    results.append(callback())
                except Exception as error:
                    results.append(type(error).__name__)
            return results
    """)
    write(tmp_path, "prog.py", """
        import sys
        sys.path.insert(0, "vendored")
        import runner


        def good():
            return "ok"


        def bad():
            value = {}["missing"]
            return value


        print(runner.run_all([good, bad]))
    """)
    dbg = Session.debug(tmp_path, "--exceptions", "user-unhandled", "--library", "vendored",
                        "prog.py")
    try:
        dbg.prompt()
        out = dbg.do("c")
        assert stop_line(out) == "> prog.py:11 in bad()"
        assert "!! KeyError: 'missing'" in out
        assert "   (will be caught in vendored/runner.py:5 in run_all())" in out
        out, status = dbg.finish("c")
        assert "['ok', 'KeyError']" in out and status == 0
    finally:
        dbg.close()
    # Under the plain setting the same program does not stop: the library catches it.
    dbg = Session.debug(tmp_path, "--library", "vendored", "prog.py")
    try:
        dbg.prompt()
        out, status = dbg.finish("c")
        assert "!!" not in out and "['ok', 'KeyError']" in out and status == 0
    finally:
        dbg.close()


def test_failing_pytest_suite_stops_at_each_failing_assertion(tmp_path):
    write(tmp_path, "suite/test_numbers.py", """
        def double(x):
            return x * 2


        def test_passes():
            assert double(2) == 4


        def test_fails():
            result = double(3)
            assert result == 7


        def test_raises():
            values = [1, 2]
            assert values[5] == 1


        def test_fails_again():
            text = "abc"
            assert text.upper() == "abc"
    """)
    dbg = Session.debug(tmp_path, "--exceptions", "user-unhandled", "-m", "pytest", "-q",
                        "-p", "no:cacheprovider", "suite", timeout=60)
    try:
        dbg.prompt()
        out = dbg.do("c")
        # pytest's progress dots stand before the stop on the same line.
        assert ".> suite/test_numbers.py:11 in test_fails()\n" in out
        assert "!! AssertionError" in out
        assert "site-packages/" in out.split("(will be caught in ", 1)[1].splitlines()[0]
        assert dbg.do("p result") == "6\n"
        out = dbg.do("c")
        assert "> suite/test_numbers.py:16 in test_raises()\n" in out
        assert "!! IndexError: list index out of range" in out
        out = dbg.do("c")
        assert "> suite/test_numbers.py:21 in test_fails_again()\n" in out
        assert dbg.do("p text") == "'abc'\n"
        out, status = dbg.finish("c")
        assert "3 failed, 1 passed" in out
        assert status == 1
    finally:
        dbg.close()


EVERYDAY_PROGRAM = """
import contextlib
import copy
import re


class Lazy:
    @property
    def value(self):
        raise AttributeError("not yet")

    def __getattr__(self, name):
        raise AttributeError(name)


class OldSeq:
    def __getitem__(self, index):
        if index >= 3:
            raise IndexError(index)
        return index


@contextlib.contextmanager
def tolerant():
    try:
        yield
    except ValueError:
        pass


re.compile(r"x(?:y)z")
print("hasattr", hasattr(Lazy(), "value"))
print("getattr", getattr(Lazy(), "thing", "default"))
print("deepcopy", type(copy.deepcopy(Lazy())).__name__)
print("list", list(OldSeq()))
with contextlib.suppress(ValueError):
    raise ValueError("suppressed")
with tolerant():
    raise ValueError("tolerated")
print("end")
"""


def test_everyday_code_that_handles_its_exceptions_does_not_stop(tmp_path):
    write(tmp_path, "prog.py", EVERYDAY_PROGRAM)
    dbg = Session.debug(tmp_path, "--no-stop-at-start", "prog.py")
    try:
        out, status = dbg.finish()
        assert "!!" not in out and "(selvane)" not in out
        assert "hasattr False" in out and "getattr default" in out
        assert "deepcopy Lazy" in out and "list [0, 1, 2]" in out and "end" in out
        assert status == 0
    finally:
        dbg.close()


def test_the_same_exceptions_stop_when_they_escape(tmp_path):
    # A contextmanager that does not catch this type, and an iteration protocol whose
    # __getitem__ fails otherwise: each stops, once, with the place it was raised.
    write(tmp_path, "prog.py", """
        import contextlib


        @contextlib.contextmanager
        def tolerant():
            try:
                yield
            except ValueError:
                pass


        class BadSeq:
            def __getitem__(self, index):
                return {}[index]


        def first():
            with tolerant():
                raise KeyError("escapes")


        def second():
            return list(BadSeq())


        try:
            first()
        except KeyError:
            print("first handled")
        second()
    """)
    dbg = Session.debug(tmp_path, "--no-stop-at-start", "prog.py")
    try:
        out = dbg.prompt()
        assert "first handled" in out
        assert "!! KeyError: 0" in out
        # list() might have ended it; once it lets it through, nothing can catch it: the
        # stop is in second(), and the raise site is shown and reachable.
        assert stop_line(out) == "> prog.py:23 in second()"
        assert "   raised at prog.py:14 in __getitem__()" in out
        assert "prog.py:14 in __getitem__()  (finished; raised here)" in dbg.do("where")
        assert dbg.do("down").startswith("> prog.py:14 in __getitem__()  (finished")
        assert dbg.do("p index") == "0\n"
        out, status = dbg.finish("c")
        assert out.count("!!") == 0 and "KeyError: 0" in out
        assert status == 1
    finally:
        dbg.close()


def test_pytest_and_platform_start_without_a_stop(tmp_path):
    # Two programs whose start-up raises and handles exceptions in their own code and through
    # C code: a passing pytest suite, and `python -m platform`. Under the default setting
    # neither may stop; each must end as it does untraced.
    write(tmp_path, "suite/test_ok.py", """
        def test_ok():
            assert sorted({"b": 1, "a": 2}) == ["a", "b"]
    """)
    dbg = Session.debug(tmp_path, "--no-stop-at-start", "-m", "pytest", "-q",
                        "-p", "no:cacheprovider", "suite", timeout=60)
    try:
        out, status = dbg.finish()
        assert "!!" not in out and "(selvane)" not in out, out
        assert "1 passed" in out and status == 0
    finally:
        dbg.close()
    dbg = Session.debug(tmp_path, "--no-stop-at-start", "-m", "platform", timeout=60)
    try:
        out, status = dbg.finish()
        assert "!!" not in out and "(selvane)" not in out, out
        assert "Linux" in out and status == 0
    finally:
        dbg.close()

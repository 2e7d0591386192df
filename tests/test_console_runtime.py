"""End-to-end tests of the console debugger at run time: exception stops, threads,
breakpoint() through PYTHONBREAKPOINT, and Ctrl-C while the program runs. Each drives the
debugger through a pseudo-terminal (console_driver)."""

import sys
import time

from console_driver import Session, environment, stop_line, write

EXCEPTION_PROGRAM = """
def parse(text):
    number = int(text)
    return number


def safe(text):
    try:
        return parse(text)
    except ValueError:
        return -1


def lookup(values, key):
    found = values[key]
    return found


def main():
    print("safe", safe("x"))
    values = {"a": 1}
    return lookup(values, "b") + parse("7")


main()
"""


def test_unhandled_exception_stops_in_the_raising_frame(tmp_path):
    write(tmp_path, "prog.py", EXCEPTION_PROGRAM)
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        dbg.prompt()
        out = dbg.do("continue")
        # The caught ValueError in safe() did not stop; the KeyError stops where it is
        # raised, before the stack unwinds.
        assert "safe -1" in out
        assert stop_line(out) == "> prog.py:14 in lookup()"
        assert "!! KeyError: 'b'" in out
        assert "(not caught: the program ends with it)" in out
        assert dbg.do("p key, values") == "('b', {'a': 1})\n"
        assert "key = 'b'" in dbg.do("locals")
        assert dbg.do("where").splitlines()[-2:] == ["> prog.py:14 in lookup()",
                                                     "    -> found = values[key]"]
        assert dbg.do("up").startswith("> prog.py:21 in main()")
        out, status = dbg.finish("c")
        # The program ends as it would untraced: the traceback, without the debugger's own
        # frames, and status 1. The exception was shown once only.
        assert "Traceback (most recent call last):" in out
        assert "selvane" not in out.split("Traceback", 1)[1]
        assert 'File "' + str(tmp_path / "prog.py") + '", line 24, in <module>' in out
        assert out.rstrip().endswith("The program exited with status 1.")
        assert "!! KeyError" not in out
        assert status == 1
    finally:
        dbg.close()


def test_caught_exception_stops_only_when_asked(tmp_path):
    write(tmp_path, "prog.py", EXCEPTION_PROGRAM.replace("main()\n", "try:\n    main()\n"
                                                         "except KeyError:\n"
                                                         "    print('handled')\n", 1)
          .replace("\n\nmain()\n", "\n"))
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        dbg.prompt()
        assert dbg.do("catch") == ("exceptions stop: unhandled\nalways stop on: -\n"
                                   "never stop on: SystemExit, StopIteration, "
                                   "StopAsyncIteration, GeneratorExit\n")
        assert dbg.do("catch always ValueError") == "always stop on: ValueError\n"
        out = dbg.do("c")
        # parse() does not catch the ValueError itself, so it stops; safe() will catch it.
        assert stop_line(out) == "> prog.py:2 in parse()"
        assert "!! ValueError: invalid literal for int() with base 10: 'x'" in out
        assert "(will be caught in prog.py:8 in safe())" in out
        assert dbg.do("ignore-here") == \
            "exceptions at prog.py:2 will not stop the program again\n"
        out, status = dbg.finish("c")
        assert "safe -1" in out and "handled" in out
        assert status == 0
    finally:
        dbg.close()


def test_exceptions_never_and_always_modes(tmp_path):
    write(tmp_path, "prog.py", EXCEPTION_PROGRAM)
    dbg = Session.debug(tmp_path, "--exceptions", "never", "prog.py")
    try:
        dbg.prompt()
        out, status = dbg.finish("c")
        assert "KeyError: 'b'" in out and "!!" not in out
        assert status == 1
    finally:
        dbg.close()
    dbg = Session.debug(tmp_path, "--exceptions", "always", "prog.py")
    try:
        dbg.prompt()
        out = dbg.do("c")
        assert stop_line(out) == "> prog.py:2 in parse()"
        assert "(will be caught in prog.py:8 in safe())" in out
        assert dbg.do("catch never") == "exceptions stop: never\n"
        out, status = dbg.finish("c")
        assert status == 1
    finally:
        dbg.close()


def test_two_threads(tmp_path):
    write(tmp_path, "prog.py", """
        import threading

        results = []


        def worker(n):
            total = 0
            for i in range(n):
                total += i
            results.append(total)


        thread = threading.Thread(target=worker, args=(5,), name="adder")
        thread.start()
        thread.join()
        print("results", results)
    """)
    dbg = Session.debug(tmp_path, "--break", "prog.py:10", "prog.py")
    try:
        dbg.prompt()
        out = dbg.do("c")
        assert stop_line(out) == "> prog.py:10 in worker()  [adder]  (breakpoint 1)"
        assert dbg.do("p total") == "10\n"
        threads = dbg.do("threads").splitlines()
        assert len(threads) == 2
        assert threads[0].split()[:2] == ["1", "MainThread"]
        assert threads[1].split()[:3] == [">*", "2", "adder"]
        assert threads[1].endswith("prog.py:10 in worker()")
        # The main thread waits at the core's mutex inside threading: its frames show.
        out = dbg.do("thread 1")
        assert out.startswith("[MainThread] > ")
        where = dbg.do("where")
        assert "prog.py:14 in <module>()" in where
        assert dbg.do("thread 2").startswith("[adder] > prog.py:10 in worker()")
        assert dbg.do("p n") == "5\n"
        out, status = dbg.finish("c")
        assert "results [10]" in out and status == 0
    finally:
        dbg.close()


def test_exception_escaping_a_thread_is_unhandled(tmp_path):
    write(tmp_path, "prog.py", """
        import threading


        def worker():
            data = {}
            return data["missing"]


        thread = threading.Thread(target=worker, name="failing")
        thread.start()
        thread.join()
        print("main goes on")
    """)
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        dbg.prompt()
        out = dbg.do("c")
        assert stop_line(out) == "> prog.py:6 in worker()  [failing]"
        assert "!! KeyError: 'missing'" in out
        assert "(not caught: the thread ends with it)" in out
        out, status = dbg.finish("c")
        assert "main goes on" in out
        assert "Exception in thread failing" in out
        assert status == 0
    finally:
        dbg.close()


def test_breakpoint_builtin_with_pythonbreakpoint(tmp_path):
    write(tmp_path, "prog.py", """
        import sys


        def double(x):
            y = x * 2
            breakpoint()
            z = y + 1
            return z


        print("double", double(3))
        sys.exit(5)
    """)
    env = environment(PYTHONBREAKPOINT="selvane.set_trace")
    dbg = Session(["prog.py"], tmp_path, env=env)
    try:
        out = dbg.prompt()
        assert stop_line(out) == "> prog.py:7 in double()"
        assert dbg.do("p y") == "6\n"
        assert dbg.do("y = 20") == ""
        assert stop_line(dbg.do("n")) == "> prog.py:8 in double()"
        assert dbg.do("p z") == "21\n"
        assert dbg.do("where").splitlines()[0] == "  prog.py:11 in <module>()"
        out, status = dbg.finish("c")
        assert "double 21" in out
        assert status == 5
    finally:
        dbg.close()


def test_set_trace_called_directly(tmp_path):
    write(tmp_path, "prog.py", """
        import selvane

        items = [3, 1, 2]
        selvane.set_trace()
        items.sort()
        print("items", items)
    """)
    dbg = Session(["prog.py"], tmp_path)
    try:
        out = dbg.prompt()
        assert stop_line(out) == "> prog.py:5 in <module>()"
        assert dbg.do("items.append(0)") == ""
        out, status = dbg.finish("c")
        assert "items [0, 1, 2, 3]" in out and status == 0
    finally:
        dbg.close()


def test_ctrl_c_stops_a_running_loop(tmp_path):
    write(tmp_path, "prog.py", """
        import sys
        count = 0
        running = True
        while running:
            count += 1
        print("stopped", count > 0)
        sys.exit(0 if count > 0 else 9)
    """)
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        dbg.prompt()
        dbg.child.sendline("c")
        time.sleep(0.5)
        dbg.child.sendintr()
        out = dbg.prompt()
        assert "(interrupted)" in stop_line(out)
        assert "prog.py:4 in <module>()" in stop_line(out) or \
            "prog.py:5 in <module>()" in stop_line(out)
        assert "KeyboardInterrupt" not in out
        assert dbg.do("running = False") == ""
        out, status = dbg.finish("c")
        assert "stopped True" in out
        assert status == 0
    finally:
        dbg.close()


def test_ctrl_c_at_the_prompt_keeps_the_session(tmp_path):
    write(tmp_path, "prog.py", "print('done')\n")
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        dbg.prompt()
        dbg.child.sendintr()
        dbg.prompt()
        assert dbg.do("p 1 + 1") == "2\n"
        out, status = dbg.finish("c")
        assert "done" in out and status == 0
    finally:
        dbg.close()


def test_the_example_program_under_the_debugger(tmp_path):
    """The README's session on examples/shop.py, shortened."""
    import os
    example = os.path.join(os.path.dirname(os.path.dirname(os.path.abspath(__file__))),
                           "examples", "shop.py")
    dbg = Session.debug(tmp_path, example)
    try:
        dbg.prompt()
        dbg.do("break 22")
        out = dbg.do("c")
        assert stop_line(out).endswith("shop.py:22 in summarize()  (breakpoint 1)")
        assert dbg.do("p name, count") == "('apples', 0)\n"
        dbg.do("clear 1")
        assert stop_line(dbg.do("until 24")).endswith("shop.py:24 in summarize()")
        assert dbg.do("p count, len(orders)") == "(1, 3)\n"
        out, status = dbg.finish("c")
        assert "average per order: 13.25" in out and status == 0
    finally:
        dbg.close()



def test_ctrl_c_stops_a_busy_thread_while_main_waits(tmp_path):
    write(tmp_path, "prog.py", """
        import threading

        state = {"running": True, "count": 0}


        def spin():
            while state["running"]:
                state["count"] += 1


        worker = threading.Thread(target=spin, name="spinner")
        worker.start()
        worker.join()
        print("joined", state["count"] > 0)
    """)
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        dbg.prompt()
        dbg.child.sendline("c")
        time.sleep(0.5)
        dbg.child.sendintr()
        out = dbg.prompt()
        # The main thread sits in join(): the idle callback stops the spinning thread.
        assert "[spinner]  (interrupted)" in stop_line(out)
        assert "in spin()" in stop_line(out)
        assert dbg.do("state['running'] = False") == ""
        out, status = dbg.finish("c")
        assert "joined True" in out
        assert status == 0
    finally:
        dbg.close()


def test_skip_thread_option(tmp_path):
    write(tmp_path, "prog.py", """
        import threading


        def work(results):
            results.append(len(results))


        results = []
        threads = [threading.Thread(target=work, args=(results,), name=name)
                   for name in ("skipped-1", "kept")]
        for thread in threads:
            thread.start()
            thread.join()
        print("results", results)
    """)
    dbg = Session.debug(tmp_path, "--skip-thread", "skipped-*", "--break", "prog.py:5",
                        "prog.py")
    try:
        dbg.prompt()
        out = dbg.do("c")
        assert stop_line(out) == "> prog.py:5 in work()  [kept]  (breakpoint 1)"
        assert dbg.do("p results") == "[0]\n"
        out, status = dbg.finish("c")
        assert "results [0, 1]" in out and status == 0
    finally:
        dbg.close()


def test_completion_of_commands_files_and_names(tmp_path):
    write(tmp_path, "prog.py", """
        total_value = 3
        print(total_value)
    """)
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        dbg.prompt()
        dbg.child.send("n\n")
        dbg.prompt()
        dbg.child.send("longl\t\n")
        assert "   2  ->" in dbg.prompt()
        dbg.child.send("p total_v\t\n")
        assert "3\n" in dbg.prompt()
        dbg.child.send("break prog.\t2\n")
        assert "Breakpoint 1 at prog.py:2" in dbg.prompt()
        dbg.finish("c")
    finally:
        dbg.close()


def test_printed_mode_stops_where_the_library_prints(tmp_path):
    write(tmp_path, "prog.py", """
        import threading


        def worker():
            try:
                {}["caught"]
            except KeyError:
                pass
            return {}["missing"]


        thread = threading.Thread(target=worker, name="failing")
        thread.start()
        thread.join()
        print("main goes on")
    """)
    dbg = Session.debug(tmp_path, "--exceptions", "printed", "prog.py")
    try:
        dbg.prompt()
        out = dbg.do("c")
        # Not at the caught KeyError; at the thread start-up code that prints the other.
        assert "in _bootstrap_inner()  [failing]" in stop_line(out)
        assert "!! KeyError: 'missing'" in out
        assert "(caught here and printed)" in out
        assert dbg.do("catch").startswith("exceptions stop: printed")
        out, status = dbg.finish("c")
        assert "Exception in thread failing" in out and "main goes on" in out
        assert status == 0
    finally:
        dbg.close()


def test_always_mode_stops_at_each_new_exception(tmp_path):
    write(tmp_path, "prog.py", """
        def check(i):
            if i % 2:
                raise ValueError(i)
            return i


        kept = []
        for i in range(5):
            try:
                kept.append(check(i))
            except ValueError:
                pass
        print("kept", kept)
    """)
    dbg = Session.debug(tmp_path, "--exceptions", "always", "prog.py")
    try:
        dbg.prompt()
        for expected in ("1", "3"):
            out = dbg.do("c")
            assert stop_line(out) == "> prog.py:3 in check()"
            assert f"!! ValueError: {expected}" in out
            assert "(will be caught in prog.py:10 in <module>())" in out
            # Each new exception stops (even where it reuses the memory of the last); the
            # one shown does not stop again in each caller on its way out.
        out, status = dbg.finish("c")
        assert "kept [0, 2, 4]" in out and status == 0
    finally:
        dbg.close()

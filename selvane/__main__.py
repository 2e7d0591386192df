"""``python -m selvane [options] script.py [args...]`` and
``python -m selvane [options] -m module [args...]``: run a program under the console
debugger. It stops before the program's first line and shows a prompt; `help` lists the
commands."""

import argparse
import os
import sys

USAGE = "python -m selvane [options] (script.py | -m module) [args...]"


def _parser():
    parser = argparse.ArgumentParser(
        prog="python -m selvane", usage=USAGE,
        description="Run a Python program under the selvane console debugger. The program "
                    "stops before its first line; type `help` at the prompt for the "
                    "commands.")
    parser.add_argument("-c", "--command", action="append", default=[], metavar="COMMAND",
                        help="a debugger command to run at the first stop (repeatable)")
    parser.add_argument("-m", dest="module", metavar="MODULE",
                        help="run a library module as a script, as `python -m` does")
    parser.add_argument("--break", dest="breaks", action="append", default=[],
                        metavar="FILE:LINE", help="set a breakpoint before the program runs "
                        "(repeatable)")
    parser.add_argument("--exceptions",
                        choices=("never", "always", "unhandled", "user-unhandled", "printed"),
                        default="unhandled",
                        help="which exceptions stop the program (default: unhandled; "
                        "user-unhandled: also those that leave the program's own code into "
                        "library code that catches them, as a test runner does; printed: "
                        "where the standard library catches and prints them)")
    parser.add_argument("--library", action="append", default=[], metavar="PATH",
                        help="count the code in this folder (or file) as library code, as "
                        "the standard library and site-packages are, for --exceptions "
                        "user-unhandled (repeatable)")
    parser.add_argument("--no-autoquit", action="store_true",
                        help="keep tracing after a thread's outermost frame returns")
    parser.add_argument("--one-thread", action="store_true",
                        help="while one thread is stopped, run the others untraced instead "
                        "of holding them")
    parser.add_argument("--skip-thread", action="append", default=[], metavar="PATTERN",
                        help="do not debug threads whose name matches this pattern "
                        "(repeatable)")
    parser.add_argument("--sub-language", action="append", default=[],
                        metavar="MODULE:OBJECT",
                        help="register a sub-language hook (a template language, say) before "
                        "the program runs, so that its files take breakpoints and its lines "
                        "are stepped through: OBJECT is the hook, or a class or factory "
                        "called without arguments to make it; MODULE is imported with the "
                        "program's folder on the path (repeatable)")
    parser.add_argument("--no-stop-at-start", action="store_true",
                        help="run to the first breakpoint instead of stopping before the "
                        "first line")
    parser.add_argument("script", nargs="?", help="the program to debug")
    parser.add_argument("args", nargs=argparse.REMAINDER, help="the program's arguments")
    return parser


def _split(argv):
    """Options are ours up to the script (or -m MODULE); everything after is the program's."""
    ours = []
    i = 0
    takes_value = {"-c", "--command", "--break", "--exceptions", "--skip-thread",
                   "--sub-language", "--library"}
    while i < len(argv):
        arg = argv[i]
        if arg == "-m":
            if i + 1 >= len(argv):
                return ours + [arg], None, []
            return ours, ("module", argv[i + 1]), argv[i + 2:]
        if arg == "--":
            if i + 1 >= len(argv):
                return ours, None, []
            return ours, ("script", argv[i + 1]), argv[i + 2:]
        if arg.startswith("-") and arg != "-":
            ours.append(arg)
            if arg in takes_value and i + 1 < len(argv):
                ours.append(argv[i + 1])
                i += 1
            i += 1
            continue
        return ours, ("script", arg), argv[i + 1:]
    return ours, None, []


def main(argv=None):
    argv = sys.argv[1:] if argv is None else argv
    parser = _parser()
    ours, target, program_args = _split(argv)
    options = parser.parse_args(ours)
    if target is None:
        parser.print_usage(sys.stderr)
        print("python -m selvane: error: a script or -m MODULE is needed", file=sys.stderr)
        return 2

    from .console import Console, Terminal
    from .runner import Program, ProgramError, run
    from .session import Session, SessionError, _show_path, load_sub_language_hook

    program = Program(target[1], program_args, is_module=target[0] == "module")
    try:
        program.prepare()
    except ProgramError as error:
        print(f"python -m selvane: {error}", file=sys.stderr)
        return error.status

    terminal = Terminal.open()
    console = Console(terminal, commands=options.command)
    try:
        session = Session(console, exceptions=options.exceptions,
                          autoquit=not options.no_autoquit,
                          debug_all_threads=not options.one_thread,
                          skip_threads=options.skip_thread, library=options.library)
    except SessionError as error:
        print(f"python -m selvane: {error}", file=sys.stderr)
        return 2
    session.main_file = program.file
    for spec in options.sub_language:
        try:
            session.register_sub_language_hook(_hook_for(spec, program,
                                                         load_sub_language_hook))
        except SessionError as error:
            print(f"python -m selvane: --sub-language {spec}: {error}", file=sys.stderr)
            return 2
    for location in options.breaks:
        try:
            bp = session.add_breakpoint(location)
        except SessionError as error:
            print(f"python -m selvane: --break {location}: {error}", file=sys.stderr)
            return 2
        console.say(f"Breakpoint {bp.number} at {_show_path(bp.file)}:{bp.line}")

    def on_start():
        session.program_started()
        session.start(stop_at_first_line=not options.no_stop_at_start,
                      first_stop=lambda frame: frame.f_code is program.code)

    status = run(session, program, on_start)
    session.finish()
    console.say(f"The program exited with status {status}.")
    return status


def _hook_for(spec, program, load):
    """Loads a hook as the program would import it: its folder first on the path."""
    added = program.path0 is not None and program.path0 not in sys.path
    if added:
        sys.path.insert(0, program.path0)
    try:
        return load(spec)
    finally:
        if added:
            sys.path.remove(program.path0)


if __name__ == "__main__":
    sys.exit(main())

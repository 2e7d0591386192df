"""Drives `python -m selvane` through a pseudo-terminal, as a person at a terminal would.

Every wait has a timeout, so a debugger that hangs fails its test instead of blocking the
run. TERM=dumb keeps the line editor's escape sequences out of what the tests read.
"""

import os
import re
import sys
import textwrap

import pexpect

PROMPT = "(selvane) "
TIMEOUT = 15


def write(tmp_path, name, source):
    path = tmp_path / name
    path.parent.mkdir(parents=True, exist_ok=True)
    path.write_text(textwrap.dedent(source).lstrip("\n"))
    return path


def environment(**extra):
    env = dict(os.environ, TERM="dumb")
    env.pop("PYTHONBREAKPOINT", None)
    env.update(extra)
    return env


class Session:
    """One debugger run in a pseudo-terminal."""

    def __init__(self, args, cwd, env=None, shell=None, timeout=TIMEOUT):
        if shell is not None:  # a shell line, for redirections
            self.child = pexpect.spawn("/bin/bash", ["-c", shell], cwd=str(cwd),
                                       env=env or environment(), encoding="utf-8",
                                       timeout=timeout, dimensions=(40, 200))
        else:
            self.child = pexpect.spawn(sys.executable, list(args), cwd=str(cwd),
                                       env=env or environment(), encoding="utf-8",
                                       timeout=timeout, dimensions=(40, 200))
        self.transcript = []

    @classmethod
    def debug(cls, tmp_path, *args, **kwargs):
        return cls(["-m", "selvane", *map(str, args)], tmp_path, **kwargs)

    def prompt(self):
        """Waits for the prompt; answers what was shown since the last command."""
        try:
            self.child.expect_exact(PROMPT)
        except (pexpect.TIMEOUT, pexpect.EOF) as error:
            raise AssertionError(f"no prompt ({type(error).__name__}); output so far:\n"
                                 f"{''.join(self.transcript)}{self.child.before}") from None
        text = _clean(self.child.before)
        self.transcript.append(text + PROMPT)
        return text

    def do(self, line):
        """Types a command and answers its output (up to the next prompt)."""
        self.child.sendline(line)
        text = self.prompt()
        # The terminal echoes the typed line first.
        first, _, rest = text.partition("\n")
        return rest if first.strip() == line.strip() else text

    def finish(self, line=None):
        """Types a last command (if any) and waits for the debugger to end; answers the
        output and the exit status."""
        if line is not None:
            self.child.sendline(line)
        try:
            self.child.expect(pexpect.EOF)
        except pexpect.TIMEOUT:
            raise AssertionError("the debugger did not end; output so far:\n"
                                 f"{''.join(self.transcript)}{self.child.before}") from None
        text = _clean(self.child.before)
        self.transcript.append(text)
        self.child.close()
        status = self.child.exitstatus
        if status is None:
            status = -self.child.signalstatus
        return text, status

    def close(self):
        if self.child.isalive():
            self.child.terminate(force=True)


def _clean(text):
    return re.sub(r"\x1b\[[0-9;?]*[a-zA-Z]", "", text).replace("\r\n", "\n").replace("\r", "")


def stop_line(output):
    """The `> file:line in function()` line of a stop."""
    for line in output.splitlines():
        if line.startswith("> "):
            return line
    raise AssertionError(f"no stop shown in:\n{output}")

"""Tells, from the byte code of the frames on the stack, whether an exception that has just
been raised will be caught, so that a stop at an exception can say so before the stack
unwinds.

It reads each frame's exception table (3.11 and later) at the instruction the frame is at,
decodes the `except` clauses of the handler found there and tests the exception against the
classes they name, looked up in the frame's own namespaces without running any code. A
`finally` or `with` block catches nothing by itself: the search goes on past it. A shape of
byte code not recognised here counts as not catching, as the core counts it.
"""

import builtins
import dis

_LOADS_BY_NAME = {"LOAD_GLOBAL", "LOAD_NAME", "LOAD_FAST", "LOAD_FAST_CHECK", "LOAD_DEREF",
                  "LOAD_CLASSDEREF", "LOAD_FROM_DICT_OR_GLOBALS"}
_INSTRUCTIONS = {}  # code object -> (instructions, index by offset, exception table)


def _decoded(code):
    known = _INSTRUCTIONS.get(code)
    if known is None:
        instructions = list(dis.get_instructions(code))
        index = {ins.offset: i for i, ins in enumerate(instructions)}
        try:
            table = list(dis._parse_exception_table(code))
        except Exception:  # the helper is the dis module's own; a change there means "unknown"
            table = []
        known = _INSTRUCTIONS[code] = (instructions, index, table)
    return known


def _lookup(frame, opname, name):
    if opname in ("LOAD_FAST", "LOAD_FAST_CHECK", "LOAD_DEREF", "LOAD_CLASSDEREF"):
        scopes = (frame.f_locals,)
    elif opname == "LOAD_GLOBAL":
        scopes = (frame.f_globals, vars(builtins))
    else:
        scopes = (frame.f_locals, frame.f_globals, vars(builtins))
    for scope in scopes:
        if name in scope:
            return scope[name]
    raise LookupError(name)


def _clause_classes(frame, instructions, start):
    """Evaluates the class expression of an `except` clause whose loads begin at index
    `start`; returns (classes, index of its CHECK_EXC_MATCH), or None for an unknown shape."""
    stack = []
    i = start
    while i < len(instructions):
        ins = instructions[i]
        name = ins.opname
        if name == "CHECK_EXC_MATCH":
            return (stack[-1] if stack else None), i
        if name in _LOADS_BY_NAME:
            stack.append(_lookup(frame, name, ins.argval))
        elif name == "LOAD_ATTR":
            if not stack:
                return None
            # Attribute look-up on a module or class: reading the attribute of a module is
            # side-effect free; anything fancier is not an except clause people write.
            stack.append(getattr(stack.pop(), ins.argval))
        elif name == "BUILD_TUPLE":
            count = ins.arg or 0
            if count > len(stack):
                return None
            items = tuple(stack[len(stack) - count:])
            del stack[len(stack) - count:]
            stack.append(items)
        elif name in ("NOP", "CACHE", "EXTENDED_ARG"):
            pass
        else:
            return None
        i += 1
    return None


def _matches(exc_type, classes):
    try:
        return issubclass(exc_type, classes)
    except TypeError:
        return False


def frame_catches(frame, exc_type, offset):
    """True when the handler active at `offset` of `frame` catches `exc_type`."""
    instructions, index, table = _decoded(frame.f_code)
    for _ in range(64):  # nested blocks of one frame; the bound only guards odd code
        entry = next((e for e in table if e.start <= offset < e.end), None)
        if entry is None or entry.target not in index:
            return False
        i = index[entry.target]
        if instructions[i].opname != "PUSH_EXC_INFO":
            # The cleanup of an except block, which only re-raises: go on from its RERAISE.
            reraise = _next(instructions, i, "RERAISE")
            if reraise is None:
                return False
            offset = instructions[reraise].offset
            continue
        i += 1
        if i < len(instructions) and instructions[i].opname == "POP_TOP":
            return True  # a bare `except:`
        # Typed clauses one after the other; a finally or with block has no CHECK_EXC_MATCH
        # before its RERAISE.
        while True:
            check = _next(instructions, i, "CHECK_EXC_MATCH", stop_at=("RERAISE",
                                                                          "CHECK_EG_MATCH"))
            if check is None:
                if _next(instructions, i, "CHECK_EG_MATCH", stop_at=("RERAISE",)) is not None:
                    return False  # except* groups: not predicted
                # A finally block, or a with block whose __exit__ is taken not to swallow the
                # exception: the search goes on from its RERAISE.
                reraise = _next(instructions, i, "RERAISE")
                if reraise is None:
                    return False
                offset = instructions[reraise].offset
                break
            try:
                decoded = _clause_classes(frame, instructions, i)
            except (LookupError, AttributeError):
                return False
            if decoded is None:
                return False
            classes, check = decoded
            if _matches(exc_type, classes):
                return True
            jump = instructions[check + 1] if check + 1 < len(instructions) else None
            if jump is None or "IF_FALSE" not in jump.opname or jump.argval not in index:
                return False
            i = index[jump.argval]
            if instructions[i].opname == "RERAISE":  # no clause matched
                offset = instructions[i].offset
                break
    return False


def _next(instructions, i, opname, stop_at=()):
    while i < len(instructions):
        name = instructions[i].opname
        if name == opname:
            return i
        if name in stop_at:
            return None
        i += 1
    return None


def find_handler(frame, exc_type, boundary_codes=()):
    """The first frame from `frame` outward whose active handler catches `exc_type`, or None.
    A frame running one of `boundary_codes` (the debugger's runner, a thread's start-up
    code) is the edge of the program: an exception that reaches it is not caught."""
    while frame is not None:
        if frame.f_code in boundary_codes:
            return None
        try:
            if frame_catches(frame, exc_type, frame.f_lasti):
                return frame
        except Exception:  # never let the prediction disturb a stop
            return None
        frame = frame.f_back
    return None

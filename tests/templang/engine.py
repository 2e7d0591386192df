"""The template language's parser and renderer.

A template is read line by line. A line is one of:
  text with `{{ expression }}` substitutions     written out, with its newline
  `{% for NAME[, NAME...] in EXPRESSION %}`      the lines up to its `{% end %}`, per item
  `{% if EXPRESSION %}` ... [`{% else %}` ...]   one branch
  `{% end %}`                                    closes a for or an if
  `{% set NAME = EXPRESSION %}`                  binds a variable
  `{# comment #}`                                nothing at all
Expressions are Python expression syntax (names, constants, attributes, items, arithmetic,
comparisons, and/or/not, conditional expressions, list/tuple/dict displays and calls); the
names are the variables given to render() and those the template binds.

How the debugger sees it: `render` is the entry (the marker function), and every template
line that runs is one call of `_execute` (the key function), loop lines once per pass. So
that an error of a line has `_execute` as its innermost Python frame, expressions are
compiled to a postfix program when the template is read and evaluated by a loop inside
`_execute` with `operator` functions and dict look-ups only: no Python helper frame sits
between the line and what it calls, and a Python function that the template calls runs as a
direct callee of `_execute`. While rendering, nothing here calls a Python-level function of
the standard library (reading, parsing and path handling use built-ins only), so stepping
into a template meets no library frame outside this package.
"""

import ast
import operator
import os

__all__ = ["render", "TemplateSyntaxError"]


class TemplateSyntaxError(Exception):
    """A template that cannot be read; `path` and `line` say where."""

    def __init__(self, message, path, line):
        super().__init__(f"{path}:{line}: {message}")
        self.path = path
        self.line = line


class Template:
    def __init__(self, path, text):
        self.path = path  # an absolute path, or "<string>"
        self.text = text
        self.body = []  # the block tree of _Node objects


class Line:
    """One template line that runs: what `_execute` receives."""

    __slots__ = ("template", "number", "kind", "code", "targets")

    def __init__(self, template, number, kind, code, targets=()):
        self.template = template
        self.number = number
        self.kind = kind  # "text", "for", "if" or "set"
        self.code = code  # the postfix program: a tuple of operations
        self.targets = targets  # the names bound by a for or set line

    def __repr__(self):
        return f"<template line {self.template.path}:{self.number} ({self.kind})>"


class _Node:
    __slots__ = ("line", "body", "orelse")

    def __init__(self, line):
        self.line = line
        self.body = []
        self.orelse = []


_BUILTINS = {f.__name__: f for f in (len, range, str, int, float, bool, min, max, sum, sorted,
                                     enumerate, zip, abs, round, list, dict, tuple, reversed)}
_EXHAUSTED = object()
# compile() with this flag gives the syntax tree straight from the interpreter's parser,
# without running the ast module's Python code.
_ONLY_AST = ast.PyCF_ONLY_AST
_TEMPLATES = {}  # absolute path -> Template


# ---- rendering ------------------------------------------------------------------------------


def render(path_or_text, **variables):
    """Renders a template file (a path) or a template text (a string holding a newline) with
    these variables; answers the text. Raises what a template line raises, and
    TemplateSyntaxError for a template that cannot be read."""
    template = _load(path_or_text)
    out = []
    _run_block(template.body, dict(variables), out)
    return "".join(out)


def _run_block(nodes, ctx, out):
    for node in nodes:
        line = node.line
        if line.kind == "for":
            iterator = _execute(line, ctx, out)
            while iterator is not None:
                _run_block(node.body, ctx, out)
                iterator = _execute(line, ctx, out, iterator)
        elif line.kind == "if":
            if _execute(line, ctx, out):
                _run_block(node.body, ctx, out)
            else:
                _run_block(node.orelse, ctx, out)
        else:
            _execute(line, ctx, out)


def _execute(line, ctx, out, iterator=None):
    """Runs one template line. A text line writes itself out; a for line binds the next item
    (taking the iterator over the items on its first pass) and answers the iterator, or None
    when the items are exhausted; an if line answers its condition's truth; a set line binds
    its variable. Every operation is done right here (see the module's docstring)."""
    kind = line.kind
    if kind == "for" and iterator is not None:
        code = ()  # the items were taken on the first pass
    else:
        code = line.code
    stack = []
    pc = 0
    end = len(code)
    while pc < end:
        op = code[pc]
        pc += 1
        name = op[0]
        if name == "const":
            stack.append(op[1])
        elif name == "text":
            out.append(op[1])
        elif name == "emit":
            out.append(str(stack.pop()))
        elif name == "name":
            if op[1] in ctx:
                stack.append(ctx[op[1]])
            elif op[1] in _BUILTINS:
                stack.append(_BUILTINS[op[1]])
            else:
                raise NameError(f"name {op[1]!r} is not defined")
        elif name == "binary":
            right = stack.pop()
            stack.append(op[1](stack.pop(), right))
        elif name == "contains":
            items = stack.pop()
            stack.append(operator.contains(items, stack.pop()))
        elif name == "unary":
            stack.append(op[1](stack.pop()))
        elif name == "attr":
            stack.append(getattr(stack.pop(), op[1]))
        elif name == "call":
            count, keywords = op[1], op[2]
            kwargs = {}
            for key in reversed(keywords):
                kwargs[key] = stack.pop()
            args = stack[len(stack) - count:]
            del stack[len(stack) - count:]
            function = stack.pop()
            stack.append(function(*args, **kwargs))
        elif name == "list" or name == "tuple":
            items = stack[len(stack) - op[1]:]
            del stack[len(stack) - op[1]:]
            stack.append(items if name == "list" else tuple(items))
        elif name == "dict":
            items = stack[len(stack) - 2 * op[1]:]
            del stack[len(stack) - 2 * op[1]:]
            stack.append(dict(zip(items[0::2], items[1::2])))
        elif name == "slice":
            step = stack.pop()
            stop = stack.pop()
            stack.append(slice(stack.pop(), stop, step))
        elif name == "jump":
            pc = op[1]
        elif name == "jump_if_false":
            if not stack.pop():
                pc = op[1]
        elif name == "jump_if_false_or_pop":  # `and`: keep the false value as the result
            if stack[-1]:
                stack.pop()
            else:
                pc = op[1]
        elif name == "jump_if_true_or_pop":  # `or`
            if stack[-1]:
                pc = op[1]
            else:
                stack.pop()
        else:
            raise RuntimeError(f"unknown template operation {name!r}")
    if kind == "for":
        if iterator is None:
            iterator = iter(stack.pop())
        item = next(iterator, _EXHAUSTED)
        if item is _EXHAUSTED:
            return None
        targets = line.targets
        if len(targets) == 1:
            ctx[targets[0]] = item
        else:
            values = tuple(item)
            if len(values) != len(targets):
                raise ValueError(f"cannot unpack {len(values)} values into "
                                 f"{len(targets)} names")
            for target, value in zip(targets, values):
                ctx[target] = value
        return iterator
    if kind == "if":
        return bool(stack.pop())
    if kind == "set":
        ctx[line.targets[0]] = stack.pop()
    return None


# ---- reading ------------------------------------------------------------------------------


def _load(path_or_text):
    if "\n" in path_or_text:
        return _parse("<string>", path_or_text)
    path = os.fspath(path_or_text)
    if not path.startswith(os.sep):
        path = os.getcwd() + os.sep + path
    template = _TEMPLATES.get(path)
    if template is None:
        # Bytes decoded here: a text-mode file would run the codecs module's Python code.
        with open(path, "rb") as f:
            text = f.read().decode("utf-8")
        template = _TEMPLATES[path] = _parse(path, text)
    return template


def _parse(path, text):
    template = Template(path, text)
    lines = text.split("\n")
    if lines and lines[-1] == "":
        lines.pop()  # the final newline ends the last line; it starts no new one
    # Blocks being filled: (the for or if node or None for the top, the list filled now).
    open_blocks = [(None, template.body)]
    for number, source in enumerate(lines, 1):
        stripped = source.strip()
        if stripped.startswith("{#") and stripped.endswith("#}"):
            continue
        if stripped.startswith("{%") and stripped.endswith("%}"):
            _statement(template, number, stripped[2:-2].strip(), open_blocks)
            continue
        if "{%" in stripped:
            raise TemplateSyntaxError("a {% statement %} must stand alone on its line", path,
                                      number)
        code = []
        rest = source
        while "{{" in rest:
            before, _, after = rest.partition("{{")
            expression, found, rest = after.partition("}}")
            if not found:
                raise TemplateSyntaxError("{{ without }}", path, number)
            if before:
                code.append(("text", before))
            _compile(expression, code, path, number)
            code.append(("emit",))
        code.append(("text", rest + "\n"))
        open_blocks[-1][1].append(_Node(Line(template, number, "text", tuple(code))))
    if len(open_blocks) > 1:
        node = open_blocks[-1][0]
        raise TemplateSyntaxError(f"{{% {node.line.kind} %}} without {{% end %}}", path,
                                  node.line.number)
    return template


def _statement(template, number, statement, open_blocks):
    path = template.path
    keyword, _, rest = statement.partition(" ")
    rest = rest.strip()
    if keyword == "for":
        names, found, expression = rest.partition(" in ")
        targets = tuple(n.strip() for n in names.split(","))
        if not found or not all(t.isidentifier() for t in targets):
            raise TemplateSyntaxError("expected {% for NAME[, NAME...] in EXPRESSION %}", path,
                                      number)
        node = _Node(Line(template, number, "for", _compiled(expression, path, number),
                          targets))
        open_blocks[-1][1].append(node)
        open_blocks.append((node, node.body))
    elif keyword == "if":
        node = _Node(Line(template, number, "if", _compiled(rest, path, number)))
        open_blocks[-1][1].append(node)
        open_blocks.append((node, node.body))
    elif keyword == "else" and not rest:
        node, filling = open_blocks[-1]
        if node is None or node.line.kind != "if" or filling is node.orelse:
            raise TemplateSyntaxError("{% else %} outside an {% if %}", path, number)
        open_blocks[-1] = (node, node.orelse)
    elif keyword == "end" and not rest:
        if len(open_blocks) == 1:
            raise TemplateSyntaxError("{% end %} without a block to close", path, number)
        open_blocks.pop()
    elif keyword == "set":
        name, found, expression = rest.partition("=")
        if not found or not name.strip().isidentifier():
            raise TemplateSyntaxError("expected {% set NAME = EXPRESSION %}", path, number)
        line = Line(template, number, "set", _compiled(expression, path, number),
                    (name.strip(),))
        open_blocks[-1][1].append(_Node(line))
    else:
        raise TemplateSyntaxError(f"unknown statement {{% {statement} %}}", path, number)


def _compiled(expression, path, number):
    code = []
    _compile(expression, code, path, number)
    return tuple(code)


# ---- expressions ----------------------------------------------------------------------------

_BINARY = {ast.Add: operator.add, ast.Sub: operator.sub, ast.Mult: operator.mul,
           ast.Div: operator.truediv, ast.FloorDiv: operator.floordiv, ast.Mod: operator.mod,
           ast.Pow: operator.pow}
_UNARY = {ast.USub: operator.neg, ast.UAdd: operator.pos, ast.Not: operator.not_}
_COMPARE = {ast.Eq: operator.eq, ast.NotEq: operator.ne, ast.Lt: operator.lt,
            ast.LtE: operator.le, ast.Gt: operator.gt, ast.GtE: operator.ge,
            ast.Is: operator.is_, ast.IsNot: operator.is_not}


def _compile(expression, code, path, number):
    """Appends the postfix program of `expression` to `code`."""
    try:
        tree = compile(expression.strip(), path, "eval", _ONLY_AST)
    except SyntaxError as error:
        raise TemplateSyntaxError(f"bad expression {expression.strip()!r}: {error.msg}", path,
                                  number) from None
    _emit(tree.body, code, path, number)


def _emit(node, code, path, number):
    def emit(child):
        _emit(child, code, path, number)

    def jump_here(at):  # points the jump at index `at` to the end of the code so far
        code[at] = (code[at][0], len(code))

    if isinstance(node, ast.Constant):
        code.append(("const", node.value))
    elif isinstance(node, ast.Name):
        code.append(("name", node.id))
    elif isinstance(node, ast.Attribute):
        emit(node.value)
        code.append(("attr", node.attr))
    elif isinstance(node, ast.Subscript):
        emit(node.value)
        emit(node.slice)
        code.append(("binary", operator.getitem))
    elif isinstance(node, ast.Slice):
        for part in (node.lower, node.upper, node.step):
            if part is None:
                code.append(("const", None))
            else:
                emit(part)
        code.append(("slice",))
    elif isinstance(node, ast.BinOp) and type(node.op) in _BINARY:
        emit(node.left)
        emit(node.right)
        code.append(("binary", _BINARY[type(node.op)]))
    elif isinstance(node, ast.UnaryOp) and type(node.op) in _UNARY:
        emit(node.operand)
        code.append(("unary", _UNARY[type(node.op)]))
    elif isinstance(node, ast.Compare) and len(node.ops) == 1:
        emit(node.left)
        emit(node.comparators[0])
        test = type(node.ops[0])
        if test in _COMPARE:
            code.append(("binary", _COMPARE[test]))
        elif test in (ast.In, ast.NotIn):
            # operator.contains takes the container first: no Python helper frame needed.
            code.append(("contains",))
            if test is ast.NotIn:
                code.append(("unary", operator.not_))
        else:
            raise TemplateSyntaxError(f"{test.__name__} is not supported in templates", path,
                                      number)
    elif isinstance(node, ast.BoolOp):
        jump = "jump_if_false_or_pop" if isinstance(node.op, ast.And) else "jump_if_true_or_pop"
        jumps = []
        for value in node.values[:-1]:
            emit(value)
            jumps.append(len(code))
            code.append((jump, None))
        emit(node.values[-1])
        for at in jumps:
            jump_here(at)
    elif isinstance(node, ast.IfExp):
        emit(node.test)
        to_else = len(code)
        code.append(("jump_if_false", None))
        emit(node.body)
        to_end = len(code)
        code.append(("jump", None))
        jump_here(to_else)
        emit(node.orelse)
        jump_here(to_end)
    elif isinstance(node, ast.Call) and not any(isinstance(a, ast.Starred) for a in node.args) \
            and all(k.arg is not None for k in node.keywords):
        emit(node.func)
        for arg in node.args:
            emit(arg)
        for keyword in node.keywords:
            emit(keyword.value)
        code.append(("call", len(node.args), tuple(k.arg for k in node.keywords)))
    elif isinstance(node, (ast.List, ast.Tuple)) and \
            not any(isinstance(e, ast.Starred) for e in node.elts):
        for element in node.elts:
            emit(element)
        code.append(("list" if isinstance(node, ast.List) else "tuple", len(node.elts)))
    elif isinstance(node, ast.Dict) and None not in node.keys:
        for key, value in zip(node.keys, node.values):
            emit(key)
            emit(value)
        code.append(("dict", len(node.keys)))
    else:
        raise TemplateSyntaxError(f"{type(node).__name__} is not supported in templates", path,
                                  number)

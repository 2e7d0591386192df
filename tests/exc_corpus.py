"""A generated corpus of small programs that raise, with the truth about each raise.

Every program raises through ``mark(...)``, which numbers each exception object as it is
raised. Running a program untraced tells, for each numbered raise, whether that very object
left the program (escaped) or ended inside it (caught by an except clause, ended a loop, was
turned into another exception by the interpreter). Anything that predicts "will this be
caught?" at the moment of the raise can be checked against that truth:

    for text, escaping in cases():
        ...   # run `text` traced; the raises numbered in `escaping` must be the only ones
              # predicted as not caught

``corpus()`` yields richer records (name, category, text, every raise with its truth).
Categories: "plain" shapes the analysis must get right; "unknown" shapes it deliberately
does not read (a call in the class expression), whose predictions are only counted.
``boundary_corpus()`` yields programs of the category "boundary": C code between Python
frames (getattr with a default, hasattr, sorted with a key, map, the old sequence protocol)
and `with` blocks (contextlib.suppress, a @contextmanager generator that catches, an exit
that swallows everything, one that lets everything go). At the raise the analysis may only
say "may be caught" there; the stop decision must still fire exactly for the escaping ones.

Run as a script to print the truth statistics of the corpus for this interpreter.
"""

import random
import sys

PRELUDE = '''\
import types
_RAISED = []
def mark(exc, tag):
    exc._corpus_seq = len(_RAISED)
    exc._corpus_tag = tag
    _RAISED.append(tag)
    return exc
class Base(Exception): pass
class Mid(Base): pass
class Leaf(Mid): pass
class Other(Exception): pass
mod = types.ModuleType('mod')
mod.sub = types.ModuleType('mod.sub')
mod.Leaf = Leaf
mod.Other = Other
mod.sub.Mid = Mid
def pick(cls):
    return cls
class CM:
    def __enter__(self):
        return self
    def __exit__(self, *exc_info):
        return None
class Stopper:
    def __init__(self, tag):
        self.tag = tag
    def __iter__(self):
        return self
    def __next__(self):
        raise mark(StopIteration(self.tag), self.tag)
class Seq:
    def __init__(self, tag):
        self.tag = tag
    def __getitem__(self, index):
        raise mark(IndexError(self.tag), self.tag)
class AStopper:
    def __init__(self, tag):
        self.tag = tag
    def __aiter__(self):
        return self
    async def __anext__(self):
        raise mark(StopAsyncIteration(self.tag), self.tag)
def drive(coro):
    try:
        while True:
            coro.send(None)
    except StopIteration as stop:
        return stop.value
'''

RAISED_CLASSES = ["Leaf", "Mid", "Other", "KeyError"]

# Clause expressions the analysis reads. A "local:" entry is assigned to a local first.
CLAUSES = [
    "Leaf", "Mid", "Base", "Exception", "BaseException", "Other", "KeyError", "LookupError",
    "(Other, Mid)", "(KeyError, Other)", "(ValueError, LookupError, Base)", "mod.Leaf",
    "mod.sub.Mid", "mod.Other", "local:Mid", "local:Other", "local:KeyError", "pair:Other,Leaf",
    "pair:ValueError,Other",
]
UNKNOWN_CLAUSES = ["pick(Mid)", "pick(Other)"]

SITES = ["raise", "raise", "raise", "stopiter-for", "seq-for", "async-for", "gen-stop",
         "yield-from"]

SAME_FRAME_LAYERS = ["try", "try", "try", "finally", "with", "loop", "handler", "try-in-handler"]
BOUNDARIES = ["call", "call", "gen", "coro", "agen", "comp"]


def _indent(lines, by=1):
    return ["    " * by + line for line in lines]


class _Builder:
    """Builds one program from the innermost raise outward."""

    def __init__(self, rng, category):
        self.rng = rng
        self.category = category
        self.functions = []
        self.counter = 0
        self.tags = 0

    def tag(self):
        self.tags += 1
        return "r%d" % self.tags

    def name(self, prefix):
        self.counter += 1
        return "%s%d" % (prefix, self.counter)

    def clause_lines(self):
        """Lines before the try (locals) and the except lines of one try statement."""
        before, excepts = [], []
        count = self.rng.choice([1, 1, 2, 3])
        for index in range(count):
            pool = CLAUSES
            if self.category == "unknown" and index == 0:
                pool = UNKNOWN_CLAUSES
            clause = self.rng.choice(pool)
            if clause.startswith("local:"):
                var = self.name("cls")
                before.append("%s = %s" % (var, clause[6:]))
                clause = var
            elif clause.startswith("pair:"):
                a, b = self.name("a"), self.name("b")
                first, second = clause[5:].split(",")
                before.append("%s, %s = %s, %s" % (a, b, first, second))
                clause = "(%s, %s)" % (a, b)
            if self.rng.random() < 0.3:
                clause += " as " + self.name("e")
            excepts.append(clause)
        if self.rng.random() < 0.15:
            excepts.append("")  # a bare except: last
        return before, excepts

    def site(self, kind):
        tag = self.tag()
        if kind == "raise":
            cls = self.rng.choice(RAISED_CLASSES)
            return ["raise mark(%s(%r), %r)" % (cls, tag, tag)], False
        if kind == "stopiter-for":
            return ["for _x in Stopper(%r):" % tag, "    pass"], False
        if kind == "seq-for":
            return ["for _x in Seq(%r):" % tag, "    pass"], False
        if kind == "async-for":
            return ["async for _x in AStopper(%r):" % tag, "    pass"], True
        if kind == "gen-stop":
            return ["raise mark(StopIteration(%r), %r)" % (tag, tag)], False
        if kind == "yield-from":
            return ["yield from Stopper(%r)" % tag], False
        raise ValueError(kind)

    def close_function(self, body, is_async, generator):
        """Turns `body` into a new function; returns (its name, whether it is async)."""
        name = self.name("f")
        keyword = "async def" if is_async else "def"
        lines = ["%s %s():" % (keyword, name)] + _indent(body)
        if generator:
            lines += _indent(["yield 1"])
        self.functions.append("\n".join(lines))
        return name

    def build(self):
        rng = self.rng
        site_kind = rng.choice(SITES)
        body, needs_async = self.site(site_kind)
        # A generator-only site needs a generator boundary right around it (possibly after
        # some same-frame layers).
        generator_pending = site_kind in ("gen-stop", "yield-from")
        layers = rng.randint(1, 5)
        for _ in range(layers):
            if rng.random() < 0.55:
                body = self.same_frame_layer(rng.choice(SAME_FRAME_LAYERS), body)
                continue
            boundary = rng.choice(BOUNDARIES)
            if generator_pending:
                boundary = "gen"
            body, needs_async = self.boundary(boundary, body, needs_async)
            generator_pending = False
        if generator_pending:
            body, needs_async = self.boundary("gen", body, needs_async)
        if needs_async:
            name = self.close_function(body, True, False)
            body = ["drive(%s())" % name]
        main = "def main():\n" + "\n".join(_indent(body))
        return "\n\n".join([PRELUDE] + self.functions + [main, "main()\n"])

    def same_frame_layer(self, kind, body):
        if kind == "try":
            before, excepts = self.clause_lines()
            lines = before + ["try:"] + _indent(body)
            for clause in excepts:
                lines += ["except %s:" % clause if clause else "except:", "    pass"]
            return lines
        if kind == "finally":
            return ["try:"] + _indent(body) + ["finally:", "    _f = 1"]
        if kind == "with":
            return ["with CM():"] + _indent(body)
        if kind == "loop":
            return ["for _i in range(1):"] + _indent(body)
        if kind == "handler":
            tag = self.tag()
            return (["try:", "    raise mark(Other(%r), %r)" % (tag, tag), "except Other:"]
                    + _indent(body))
        if kind == "try-in-handler":
            tag = self.tag()
            before, excepts = self.clause_lines()
            inner = before + ["try:"] + _indent(body)
            for clause in excepts:
                inner += ["except %s:" % clause if clause else "except:", "    pass"]
            return (["try:", "    raise mark(KeyError(%r), %r)" % (tag, tag),
                     "except KeyError:"] + _indent(inner))
        raise ValueError(kind)

    def boundary(self, kind, body, needs_async):
        rng = self.rng
        if kind in ("call", "comp", "gen") and needs_async:
            kind = rng.choice(["coro", "agen"])
        if kind == "call":
            name = self.close_function(body, False, False)
            return ["%s()" % name], False
        if kind == "comp":
            name = self.close_function(body, False, False)
            return ["_r = [%s() for _i in range(1)]" % name], False
        if kind == "gen":
            name = self.close_function(body, False, True)
            how = rng.choice(["for", "next", "list"])
            if how == "for":
                return ["for _y in %s():" % name, "    pass"], False
            if how == "next":
                return ["next(%s())" % name], False
            return ["list(%s())" % name], False
        if kind == "coro":
            name = self.close_function(body, True, False)
            if rng.random() < 0.5:
                return ["await %s()" % name], True
            return ["drive(%s())" % name], False
        if kind == "agen":
            name = self.close_function(body, True, True)
            return ["async for _y in %s():" % name, "    pass"], True
        raise ValueError(kind)


BOUNDARY_PRELUDE = '''
import contextlib
class Swallow:
    def __enter__(self):
        return self
    def __exit__(self, *exc_info):
        return True
@contextlib.contextmanager
def catching(*types):
    try:
        yield
    except types:
        pass
def via_getattr(fn):
    class G:
        def __getattr__(self, name):
            fn()
            return 1
    return getattr(G(), "x", None)
def via_hasattr(fn):
    class H:
        @property
        def x(self):
            fn()
            return 1
    return hasattr(H(), "x")
def via_sorted(fn):
    return sorted([2, 1], key=lambda item: fn())
def via_map(fn):
    return list(map(lambda item: fn(), [0]))
class OldSeq:
    def __init__(self, fn):
        self.fn = fn
    def __getitem__(self, index):
        if index:
            raise IndexError(index)
        self.fn()
        return 0
def via_old_seq(fn):
    return list(OldSeq(fn))
'''

BOUNDARY_RAISED = RAISED_CLASSES + ["AttributeError", "IndexError"]
BOUNDARY_TYPES = ["Leaf", "Mid", "Other", "KeyError", "AttributeError", "IndexError",
                  "LookupError", "Exception"]
BOUNDARY_LAYERS = ["try", "with", "suppress", "contextmanager", "swallow", "finally"]
C_BOUNDARIES = ["getattr", "hasattr", "sorted", "map", "old_seq", "call"]


class _BoundaryBuilder(_Builder):
    """Builds one program whose raise passes C code and `with` blocks."""

    def types(self):
        return ", ".join(self.rng.sample(BOUNDARY_TYPES, self.rng.choice([1, 1, 2])))

    def build(self):
        rng = self.rng
        tag = self.tag()
        body = ["raise mark(%s(%r), %r)" % (rng.choice(BOUNDARY_RAISED), tag, tag)]
        for _ in range(rng.randint(1, 5)):
            if rng.random() < 0.5:
                body = self.boundary_layer(rng.choice(BOUNDARY_LAYERS), body)
            else:
                name = self.close_function(body, False, False)
                via = rng.choice(C_BOUNDARIES)
                body = ["%s()" % name] if via == "call" else ["via_%s(%s)" % (via, name)]
        main = "def main():\n" + "\n".join(_indent(body))
        return "\n\n".join([PRELUDE + BOUNDARY_PRELUDE] + self.functions + [main, "main()\n"])

    def boundary_layer(self, kind, body):
        if kind == "suppress":
            return ["with contextlib.suppress(%s):" % self.types()] + _indent(body)
        if kind == "contextmanager":
            return ["with catching(%s):" % self.types()] + _indent(body)
        if kind == "swallow":
            return ["with Swallow():"] + _indent(body)
        return self.same_frame_layer(kind, body)


def programs(count=600, seed=20240611):
    """Yields (name, category, text) for `count` generated programs."""
    rng = random.Random(seed)
    for index in range(count):
        category = "unknown" if index % 10 == 9 else "plain"
        text = _Builder(rng, category).build()
        yield "p%04d" % index, category, text


def run_untraced(text):
    """Runs a program untraced; returns [(seq, tag, escaped)] for every numbered raise."""
    namespace = {"__name__": "__corpus__"}
    code = compile(text, "<corpus>", "exec")
    escaped = None
    try:
        exec(code, namespace)
    except BaseException as exc:  # the program's own end: whatever leaves it
        escaped = exc
    escaped_seq = getattr(escaped, "_corpus_seq", None)
    return [(seq, tag, seq == escaped_seq) for seq, tag in enumerate(namespace["_RAISED"])]


def corpus(count=600, seed=20240611):
    """Yields (name, category, text, raises) with raises = [(seq, tag, escaped)]."""
    for name, category, text in programs(count, seed):
        yield name, category, text, run_untraced(text)


def boundary_corpus(count=200, seed=20261125):
    """Yields (name, "boundary", text, raises) as corpus() does, for programs whose raises
    pass C code and `with` blocks."""
    rng = random.Random(seed)
    for index in range(count):
        text = _BoundaryBuilder(rng, "boundary").build()
        yield "b%04d" % index, "boundary", text, run_untraced(text)


def cases(count=600, seed=20240611):
    """Yields (program_text, escaping) with escaping = [(seq, tag)] of the raises whose
    exception object left the program (at most one per program)."""
    for _name, _category, text, raises in corpus(count, seed):
        yield text, [(seq, tag) for seq, tag, escaped in raises if escaped]


def main(argv):
    count = int(argv[1]) if len(argv) > 1 else 600
    total = escaped = 0
    for name, category, text, raises in corpus(count):
        total += len(raises)
        escaped += sum(1 for r in raises if r[2])
        if "-v" in argv:
            print("#", name, category, raises)
            print(text)
    print("%d programs, %d raises, %d escape" % (count, total, escaped))


if __name__ == "__main__":
    main(sys.argv)

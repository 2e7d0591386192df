// test_handlers.cpp: the handler analysis asked at the moment of each raise, in small programs
// run under a C trace function, against what the interpreter then really does.
//
// Every case states the expected answers; where the program's own outcome decides the truth
// (the exception left the called function or not) the case also compares with that.
#include <Python.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <string>

#include "core_test_support.h"
#include "exc/handlers.h"
#include "exc/opcodes.h"
#include "handler_recorder.h"

namespace {

using coretest::HandlerRecorder;
using coretest::RaiseAnswers;

class HandlerTest : public coretest::PythonTest {
 protected:
  static void SetUpTestSuite() { ASSERT_EQ(init_handler_analysis(), 0); }

  // Runs `source` (defining main) and then main() under the recorder.
  const HandlerRecorder& run(const std::string& source, PyObject* ignored = nullptr) {
    ns_ = coretest::make_namespace(source);
    PyObject* from_program = PyDict_GetItemString(ns_.get(), "IGNORED");
    recorder_ = HandlerRecorder(ignored != nullptr ? ignored : from_program);
    escaped_ = !recorder_.run(ns_.get(), "main");
    for (const auto& raise : recorder_.raises()) {
      EXPECT_EQ(raise.pending_after, 0) << "an error was left pending after " << raise.tag;
    }
    return recorder_;
  }

  // The answer for kind 0 over all frames must be the program's own outcome.
  static void expect_truth(const RaiseAnswers& raise) {
    EXPECT_EQ(raise.handled[kMatchGiven], raise.escaped ? 0 : 1)
        << raise.type << " " << raise.tag << " raised in " << raise.where;
  }

  Ref ns_;
  HandlerRecorder recorder_;
  bool escaped_ = false;
};

TEST_F(HandlerTest, TablesComeFromTheRunningInterpreter) {
  const auto& t = bytecode::opcodes();
  ASSERT_TRUE(t.ready);
  Ref opcode = Ref::steal(PyImport_ImportModule("opcode"));
  Ref opmap = Ref::steal(PyObject_GetAttrString(opcode.get(), "opmap"));
  // A frozendict in 3.15: read as a mapping.
  Ref push = Ref::steal(PyMapping_GetItemString(opmap.get(), "PUSH_EXC_INFO"));
  ASSERT_TRUE(push);
  EXPECT_EQ(t.op[bytecode::kPushExcInfo], PyLong_AsLong(push.get()));
  Ref load_global = Ref::steal(PyMapping_GetItemString(opmap.get(), "LOAD_GLOBAL"));
  ASSERT_TRUE(load_global);
  EXPECT_GT(t.caches[PyLong_AsLong(load_global.get())], 0);
  EXPECT_EQ(t.global_name_shift, 1);
  EXPECT_EQ(t.op[bytecode::kCache], 0);
}

TEST_F(HandlerTest, SubclassMatchesGivenKindsButNotExact) {
  const auto& r = run(R"(
def main():
    try:
        raise KeyError('k')
    except LookupError:
        pass
)");
  const auto& raise = r.find("k");
  EXPECT_EQ(raise.handled[kMatchGiven], 1);
  EXPECT_EQ(raise.handled[kMatchGivenExplicit], 1);
  EXPECT_EQ(raise.handled[kMatchExact], 0);
  EXPECT_EQ(raise.this_frame[kMatchGiven], 1);
  EXPECT_EQ(raise.active, 1);
  expect_truth(raise);
}

TEST_F(HandlerTest, ExactKindMatchesTheClassAndTupleItems) {
  const auto& r = run(R"(
def main():
    try:
        raise KeyError('plain')
    except KeyError:
        pass
    try:
        raise KeyError('tuple')
    except (ValueError, KeyError):
        pass
    try:
        raise KeyError('other')
    except (ValueError, TypeError):
        pass
)");
  EXPECT_EQ(r.find("plain").handled[kMatchExact], 1);
  EXPECT_EQ(r.find("tuple").handled[kMatchExact], 1);
  EXPECT_EQ(r.find("tuple").handled[kMatchGiven], 1);
  EXPECT_EQ(r.find("other").handled[kMatchGiven], 0);
  EXPECT_TRUE(r.find("other").escaped);
}

TEST_F(HandlerTest, BareExceptCatchesOnlyForTheGivenKind) {
  const auto& r = run(R"(
def main():
    try:
        raise ValueError('bare')
    except:
        pass
    try:
        raise ValueError('late-bare')
    except KeyError:
        pass
    except:
        pass
)");
  for (const char* tag : {"bare", "late-bare"}) {
    const auto& raise = r.find(tag);
    EXPECT_EQ(raise.handled[kMatchGiven], 1) << tag;
    EXPECT_EQ(raise.handled[kMatchGivenExplicit], 0) << tag;
    EXPECT_EQ(raise.handled[kMatchExact], 0) << tag;
    expect_truth(raise);
  }
}

TEST_F(HandlerTest, ClausesAreTriedInOrder) {
  const auto& r = run(R"(
import os
def main():
    for exc in (KeyError('third'), OSError('fourth'), ZeroDivisionError('none')):
        try:
            try:
                raise exc
            except ValueError as e:
                pass
            except (TypeError, AttributeError) as e:
                pass
            except KeyError:
                pass
            except os.error:
                pass
        except ZeroDivisionError:
            pass
)");
  EXPECT_EQ(r.find("third").this_frame[kMatchGiven], 1);
  EXPECT_EQ(r.find("fourth").this_frame[kMatchGiven], 1);
  EXPECT_EQ(r.find("none").this_frame[kMatchGiven], 1);  // the outer try of the same frame
  EXPECT_EQ(r.find("none").handled[kMatchExact], 1);
}

TEST_F(HandlerTest, CallInClassExpressionCountsAsNotCatching) {
  const auto& r = run(R"(
def get_errors():
    return KeyError
def inner():
    try:
        raise KeyError('call')
    except get_errors():
        pass
def main():
    try:
        inner()
    except KeyError:
        pass
)");
  const auto& raise = r.find("call");
  EXPECT_EQ(raise.this_frame[kMatchGiven], 0);
  EXPECT_EQ(raise.handled[kMatchGiven], 1);  // the search goes on outward
}

TEST_F(HandlerTest, MissingAttributeInClauseDoesNotMatchAndLeaksNothing) {
  const auto& r = run(R"(
import types
mod = types.ModuleType('mod')
def main():
    try:
        raise KeyError('missing')
    except mod.Err:
        pass
)");
  const auto& raise = r.find("missing");
  EXPECT_EQ(raise.handled[kMatchGiven], 0);
  EXPECT_EQ(raise.pending_after, 0);
}

TEST_F(HandlerTest, RaisingGetattrInClauseIsClearedAndDoesNotMatch) {
  const auto& r = run(R"(
class Touchy:
    calls = 0
    def __getattr__(self, name):
        Touchy.calls += 1
        raise RuntimeError('no ' + name)
    @property
    def prop(self):
        Touchy.calls += 1
        raise ValueError('prop')
touchy = Touchy()
def inner():
    try:
        raise KeyError('getattr')
    except touchy.Err:
        pass
def inner2():
    try:
        raise KeyError('property')
    except touchy.prop:
        pass
def main():
    try:
        inner()
    except RuntimeError:
        pass
    try:
        inner2()
    except ValueError:
        pass
)");
  EXPECT_EQ(r.find("getattr").this_frame[kMatchGiven], 0);
  EXPECT_EQ(r.find("property").this_frame[kMatchGiven], 0);
  EXPECT_EQ(r.find("getattr").pending_after, 0);
  EXPECT_FALSE(escaped_);
}

TEST_F(HandlerTest, HandlerInOuterFrameOnlyWithoutThisFrameOnly) {
  const auto& r = run(R"(
def boom():
    raise KeyError('deep')
def mid():
    return boom()
def main():
    try:
        mid()
    except KeyError:
        pass
)");
  const auto& raise = r.find("deep");
  EXPECT_EQ(raise.this_frame[kMatchGiven], 0);
  EXPECT_EQ(raise.handled[kMatchGiven], 1);
  EXPECT_EQ(raise.handled[kMatchExact], 1);
  EXPECT_EQ(raise.active, 0);
  expect_truth(raise);
}

TEST_F(HandlerTest, IgnoredHandlersByCodeAndByFrame) {
  const auto& r = run(R"(
import sys
IGNORED = {}
def by_code():
    try:
        raise KeyError('code')
    except KeyError:
        pass
def by_frame():
    IGNORED[sys._getframe()] = True
    try:
        raise KeyError('frame')
    except KeyError:
        pass
def main():
    IGNORED[by_code.__code__] = True
    try:
        by_code()
        by_frame()
    except KeyError:
        pass
    try:
        by_code()
    finally:
        pass
)");
  // Ignored handlers are passed over; the outer try of main still counts.
  EXPECT_EQ(r.raises().size(), 3u);
  EXPECT_EQ(r.raises()[0].this_frame[kMatchGiven], 0);
  EXPECT_EQ(r.raises()[0].handled[kMatchGiven], 1);
  EXPECT_EQ(r.raises()[1].this_frame[kMatchGiven], 0);
  EXPECT_EQ(r.raises()[1].handled[kMatchGiven], 1);
  EXPECT_EQ(r.raises()[2].handled[kMatchGiven], 0);
}

TEST_F(HandlerTest, FrameHandlersIgnoredDirectly) {
  Ref ns = coretest::make_namespace(R"(
class BadKey:
    # Collides with the code object's hash and raises when compared.
    def __init__(self, code):
        self.h = hash(code)
    def __hash__(self):
        return self.h
    def __eq__(self, other):
        raise RuntimeError('compare')
def f():
    probe()
)");
  Ref ignored = Ref::steal(PyDict_New());
  bool ran = coretest::run_in_frame(ns.get(), "f", [&](PyFrameObject* frame) {
    auto* f = reinterpret_cast<PyObject*>(frame);
    EXPECT_EQ(frame_handlers_ignored(f, ignored.get()), 0);
    EXPECT_EQ(frame_handlers_ignored(f, nullptr), 0);
    EXPECT_EQ(frame_handlers_ignored(f, Py_None), 0);
    PyDict_SetItem(ignored.get(), f, Py_True);
    EXPECT_EQ(frame_handlers_ignored(f, ignored.get()), 1);
    PyDict_Clear(ignored.get());
    Ref code = Ref::steal(reinterpret_cast<PyObject*>(PyFrame_GetCode(frame)));
    PyDict_SetItem(ignored.get(), code.get(), Py_True);
    EXPECT_EQ(frame_handlers_ignored(f, ignored.get()), 1);
    EXPECT_EQ(frame_handlers_ignored(Py_None, ignored.get()), 0);
    // A key whose comparison raises: cleared, counts as not ignored.
    PyDict_Clear(ignored.get());
    Ref bad = Ref::steal(PyObject_CallOneArg(coretest::item(ns.get(), "BadKey"), code.get()));
    ASSERT_TRUE(bad);
    PyDict_SetItem(ignored.get(), bad.get(), Py_True);
    EXPECT_EQ(frame_handlers_ignored(f, ignored.get()), 0);
    EXPECT_EQ(PyErr_Occurred(), nullptr);
  });
  EXPECT_TRUE(ran);
}

TEST_F(HandlerTest, StopIterationEndingForLoopsAndYieldFrom) {
  const auto& r = run(R"(
class It:
    def __init__(self, tag):
        self.tag = tag
    def __iter__(self):
        return self
    def __next__(self):
        raise StopIteration(self.tag)
class Seq:
    def __getitem__(self, i):
        raise IndexError('seq')
def gen_returns():
    yield 1
    return 'gen-return'
def delegate():
    yield from It('yield-from')
def main():
    for x in It('for'):
        pass
    for x in Seq():
        pass
    for x in gen_returns():
        pass
    for x in delegate():
        pass
)");
  EXPECT_FALSE(escaped_);
  for (const char* tag : {"for", "seq", "yield-from"}) {
    const auto& raise = r.find(tag);
    EXPECT_EQ(raise.this_frame[kMatchGiven], 0) << tag;  // __next__ itself does not catch
    EXPECT_EQ(raise.stop_iter, 0) << tag;
  }
  // The loop's C iterator calls __next__ and __getitem__ and ends their exceptions: from
  // their frames that is C code that may end it, not a sure catch. Below `yield from` the
  // delegating generator's body is the sure end of a StopIteration.
  EXPECT_EQ(r.find("for").handled[kMatchGiven], 0);
  EXPECT_EQ(r.find("seq").handled[kMatchGiven], 0);
  EXPECT_EQ(r.find("yield-from").handled[kMatchGiven], 1);
  // A generator's return value arrives in the loop's own frame, standing on FOR_ITER.
  const auto& ret = r.find("gen-return");
  EXPECT_EQ(ret.where, "main");
  EXPECT_EQ(ret.stop_iter, 1);
  EXPECT_EQ(ret.this_frame[kMatchGiven], 1);
  EXPECT_EQ(ret.active, 0);
}

TEST_F(HandlerTest, StopIterationLeavingAGeneratorIsReplaced) {
  const auto& r = run(R"(
def gen():
    yield 1
    raise StopIteration('pep479')
def main():
    try:
        for x in gen():
            pass
    except RuntimeError as e:
        assert isinstance(e.__cause__, StopIteration)
)");
  const auto& raise = r.find("pep479");
  EXPECT_EQ(raise.this_frame[kMatchGiven], 1);
  EXPECT_EQ(raise.handled[kMatchGiven], 1);
  EXPECT_FALSE(escaped_);
}

TEST_F(HandlerTest, EveryRaiseMatchesTheProgramsOutcome) {
  // One raise per call, each either caught somewhere or let out of main.
  const char* program = R"(
import types
class E(Exception): pass
class F(E): pass
mod = types.ModuleType('mod'); mod.sub = types.ModuleType('mod.sub'); mod.sub.E = E
class CM:
    def __enter__(self): return self
    def __exit__(self, *a): return None
def attr_chain():
    try:
        raise F('attr-chain')
    except mod.sub.E:
        pass
def local_class():
    cls = E
    try:
        raise F('local')
    except cls:
        pass
def two_locals():
    a, b = KeyError, E
    try:
        raise F('two-locals')
    except (a, b):
        pass
def finally_only():
    try:
        raise E('finally')
    finally:
        pass
def with_only():
    with CM():
        raise E('with')
def with_in_try():
    try:
        with CM():
            raise E('with-in-try')
    except E:
        pass
def finally_in_try():
    try:
        try:
            raise E('finally-in-try')
        finally:
            x = 1
    except E:
        pass
def raise_in_handler():
    try:
        try:
            raise KeyError('first')
        except KeyError:
            raise E('in-handler')
    except E:
        pass
def same_try_later_clause():
    try:
        raise KeyError('k2')
    except KeyError:
        raise E('same-try')
    except E:
        pass
def nested_try_in_handler():
    try:
        raise KeyError('k3')
    except KeyError:
        try:
            raise E('nested-in-handler')
        except E:
            pass
def comprehension():
    try:
        [boom(x) for x in (1,)]
    except E:
        pass
def boom(x):
    raise E('in-comprehension')
def subclasscheck():
    class Meta(type):
        def __subclasscheck__(cls, sub):
            return True
    class Liar(Exception, metaclass=Meta): pass
    try:
        raise E('liar')
    except Liar:
        pass
def invalid_clause():
    try:
        raise E('invalid')
    except 42:
        pass
def main():
    for f in (attr_chain, local_class, two_locals, with_in_try, finally_in_try,
              raise_in_handler, nested_try_in_handler, comprehension):
        f()
    for f in (finally_only, with_only, same_try_later_clause, subclasscheck, invalid_clause):
        try:
            f()
        except BaseException:
            pass
)";
  const auto& r = run(program);
  EXPECT_FALSE(escaped_);
  struct Case {
    const char* tag;
    int this_frame;  // expected this_frame answer, kind 0
  };
  for (Case c : {Case{"attr-chain", 1}, Case{"local", 1}, Case{"two-locals", 1},
                 Case{"with-in-try", 1}, Case{"finally-in-try", 1}, Case{"in-handler", 1},
                 Case{"nested-in-handler", 1}, Case{"in-comprehension", 0}, Case{"finally", 0},
                 Case{"with", 0}, Case{"same-try", 0}, Case{"liar", 0}, Case{"invalid", 0}}) {
    const auto& raise = r.find(c.tag);
    EXPECT_EQ(raise.this_frame[kMatchGiven], c.this_frame) << c.tag;
    // main catches everything that leaves the callee with `except BaseException`.
    EXPECT_EQ(raise.handled[kMatchGiven], 1) << c.tag;
  }
  // Clauses of the try whose handler raised are not reconsidered; nothing but main catches.
  EXPECT_EQ(r.find("same-try").handled[kMatchExact], 0);
  EXPECT_EQ(r.find("with").handled[kMatchGivenExplicit], 1);
}

TEST_F(HandlerTest, ClassInClosureCellCountsAsNotCatching) {
  const auto& r = run(R"(
def main():
    cls = KeyError
    def inner():
        try:
            raise KeyError('cell')
        except cls:
            pass
    inner()
    return cls
)");
  EXPECT_EQ(r.find("cell").handled[kMatchGiven], 0);
  EXPECT_FALSE(escaped_);  // really caught: the deliberate blind spot
}

TEST_F(HandlerTest, ExceptStarTakesPlainExceptionsAndWholeGroups) {
  const auto& r = run(R"(
def main():
    try:
        raise ValueError('naked')
    except* ValueError:
        pass
    try:
        raise ExceptionGroup('whole', [ValueError(1), TypeError(2)])
    except* ValueError:
        pass
    except* (TypeError, KeyError) as eg:
        pass
    try:
        try:
            raise ExceptionGroup('part', [ValueError(1), ExceptionGroup('in', [TypeError(2)])])
        except* ValueError:
            pass
    except* TypeError:
        pass
)");
  EXPECT_FALSE(escaped_);
  EXPECT_EQ(r.find("naked").this_frame[kMatchGiven], 1);
  EXPECT_EQ(r.find("whole").this_frame[kMatchGiven], 1);
  // Exact matching takes each member by its own class.
  EXPECT_EQ(r.find("whole").this_frame[kMatchExact], 1);
  // The inner try takes only the ValueError part: not all of it is caught there; the outer
  // except* is part of the same frame's table and is not reached by the same object.
  EXPECT_EQ(r.find("part").this_frame[kMatchGiven], 0);
}

TEST_F(HandlerTest, AsyncForEndCatchesStopAsyncIteration) {
  const auto& r = run(R"(
class AIt:
    def __aiter__(self):
        return self
    async def __anext__(self):
        raise StopAsyncIteration('anext')
async def consume():
    async for x in AIt():
        pass
    try:
        await thrower()
    except KeyError:
        pass
async def thrower():
    raise KeyError('awaited')
def main():
    c = consume()
    try:
        c.send(None)
    except StopIteration:
        pass
)");
  EXPECT_FALSE(escaped_);
  EXPECT_EQ(r.find("anext").this_frame[kMatchGiven], 0);
  EXPECT_EQ(r.find("anext").handled[kMatchGiven], 1);
  EXPECT_EQ(r.find("awaited").handled[kMatchGiven], 1);
  EXPECT_EQ(r.find("awaited").this_frame[kMatchGiven], 0);
}

TEST_F(HandlerTest, ModuleLevelAndClassBodyLookUpNames) {
  const auto& r = run(R"(
SOURCE = '''
import os
try:
    raise OSError('module')
except (KeyError, os.error):
    pass
class C:
    Local = KeyError
    try:
        raise KeyError('class')
    except Local:
        pass
'''
def main():
    exec(compile(SOURCE, '<module>', 'exec'), {})
)");
  EXPECT_EQ(r.find("module").this_frame[kMatchGiven], 1);
  EXPECT_EQ(r.find("module").where, "<module>");
  EXPECT_EQ(r.find("class").this_frame[kMatchGiven], 1);
  EXPECT_EQ(r.find("class").where, "C");
}

// Operands and jumps too large for one byte (or two) are prefixed with EXTENDED_ARG; the
// exception table then needs several varint bytes per number.
TEST_F(HandlerTest, ExtendedArgumentsAndLongJumps) {
  // The clause's class is co_names[400] (LOAD_GLOBAL operand above 255), and the first
  // clause's body is long enough that the jump to the second clause passes 65535 code units.
  std::string source = "G = 0\nTarget = KeyError\n";
  std::string tuple;
  for (int i = 0; i < 400; ++i) {
    source += "a" + std::to_string(i) + " = " + std::to_string(i) + "\n";
    tuple += "a" + std::to_string(i) + ", ";
  }
  source += "def main():\n    x = (" + tuple + ")\n";
  source += "    try:\n        raise KeyError('far')\n    except ValueError:\n";
  for (int i = 0; i < 14000; ++i) source += "        v = G\n";
  source += "    except Target:\n        pass\n";
  const auto& r = run(source);
  EXPECT_EQ(r.find("far").this_frame[kMatchGiven], 1);
  EXPECT_EQ(r.find("far").this_frame[kMatchExact], 1);
  EXPECT_FALSE(escaped_);

  // The same without a matching second clause: the walk must end at its RERAISE.
  std::string missing = source;
  missing.replace(missing.rfind("except Target:"), 14, "except TypeError:");
  const auto& r2 = run(missing);
  EXPECT_EQ(r2.find("far").this_frame[kMatchGiven], 0);
  EXPECT_TRUE(escaped_);
}

TEST_F(HandlerTest, ActiveHandlerIgnoresCompilerWrappers) {
  const auto& r = run(R"(
def gen():
    yield 1
    raise KeyError('gen-no-try')
def comp():
    return [boom() for x in (1,)]
def boom():
    raise KeyError('comp')
def in_with():
    class CM:
        def __enter__(self): pass
        def __exit__(self, *a): pass
    with CM():
        raise KeyError('with')
def in_finally():
    try:
        raise KeyError('finally')
    finally:
        pass
def main():
    for f in (lambda: list(gen()), comp, in_with, in_finally):
        try:
            f()
        except KeyError:
            pass
)");
  EXPECT_EQ(r.find("gen-no-try").active, 0);
  EXPECT_EQ(r.find("comp").active, 0);
  EXPECT_EQ(r.find("with").active, 1);
  EXPECT_EQ(r.find("finally").active, 1);
}

TEST_F(HandlerTest, FindInnerFrame) {
  Ref ns = coretest::make_namespace(R"(
def a(): b()
def b(): c()
def c(): raise KeyError('tb')
def get():
    try:
        a()
    except KeyError as e:
        return e.__traceback__
)");
  Ref tb = Ref::steal(PyObject_CallNoArgs(coretest::item(ns.get(), "get")));
  ASSERT_TRUE(tb);
  Ref frame = Ref::steal(__find_inner_frame(tb.get()));
  ASSERT_TRUE(frame);
  Ref code = Ref::steal(
      reinterpret_cast<PyObject*>(PyFrame_GetCode(reinterpret_cast<PyFrameObject*>(frame.get()))));
  EXPECT_STREQ(PyUnicode_AsUTF8(reinterpret_cast<PyCodeObject*>(code.get())->co_name), "c");
  Ref none = Ref::steal(__find_inner_frame(Py_None));
  EXPECT_TRUE(none.is_none());
}

// The analysis keeps the caller's pending exception and errno, leaks no reference, and
// reports each decoded instruction on the exception channel.
TEST_F(HandlerTest, KeepsThreadStateAndReferences) {
  Ref ns = coretest::make_namespace(R"(
class E(Exception): pass
def f():
    try:
        probe()
    except (KeyError, E):
        pass
)");
  PyObject* cls = coretest::item(ns.get(), "E");
  Ref exc = Ref::steal(PyObject_CallNoArgs(cls));
  coretest::DebugCapture capture(kDbgExceptions);
  bool ran = coretest::run_in_frame(ns.get(), "f", [&](PyFrameObject* frame) {
    auto* f = reinterpret_cast<PyObject*>(frame);
    Py_ssize_t cls_refs = coretest::refs(cls);
    Py_ssize_t exc_refs = coretest::refs(exc.get());
    PyErr_SetString(PyExc_OSError, "pending");
    errno = coretest::kMarkerErrno;
    for (int i = 0; i < 50; ++i) {
      // The probe call is the instruction in progress, inside the try.
      EXPECT_EQ(__tracer_exc_handled(f, nullptr, exc.get(), kMatchGiven, 1), 1);
      EXPECT_EQ(__tracer_exc_handled(f, nullptr, cls, kMatchExact, 1), 1);
    }
    EXPECT_EQ(errno, coretest::kMarkerErrno);
    Ref pending = coretest::take_pending_exception();
    ASSERT_TRUE(pending);
    EXPECT_TRUE(PyErr_GivenExceptionMatches(pending.get(), PyExc_OSError));
    EXPECT_EQ(coretest::refs(cls), cls_refs);
    EXPECT_EQ(coretest::refs(exc.get()), exc_refs);
  });
  EXPECT_TRUE(ran);
  EXPECT_NE(capture.text().find("Returning opcode of"), std::string::npos);
}

}  // namespace

// test_pycompat.cpp: the version accessors the core relies on to keep the interpreter from
// tracing its own work: the tracing counter, the use-tracing switch built on it, and that
// the interpreter really sends no events while they say so.
#include "support/pycompat.h"

#include <gtest/gtest.h>

#include <thread>

#include "core_test_support.h"

namespace {

constexpr const char* kProgram = R"(
import sys
events = []
def python_tracer(frame, event, arg):
    events.append(event)
    return python_tracer
def work():
    total = 0
    for i in range(3):
        total += i
    return total
)";

class CompatTest : public coretest::PythonTest {
 protected:
  void SetUp() override {
    PythonTest::SetUp();
    program_ = coretest::make_namespace(kProgram);
    ts_ = PyThreadState_Get();
  }
  void TearDown() override {
    EXPECT_EQ(compat::tracing_get(ts_), 0);
    EXPECT_EQ(ts_->tracing, 0);
    PythonTest::TearDown();
  }
  void run_work() {
    Ref result = Ref::steal(PyObject_CallNoArgs(coretest::item(program_.get(), "work")));
    ASSERT_TRUE(result);
  }
  // sys.settrace(tracer) called from C, as a server side would.
  void sys_settrace(PyObject* tracer) {
    Ref sys = Ref::steal(PyImport_ImportModule("sys"));
    Ref result = Ref::steal(PyObject_CallMethod(sys.get(), "settrace", "O", tracer));
    ASSERT_TRUE(result);
  }
  Py_ssize_t python_events() { return PyList_Size(coretest::item(program_.get(), "events")); }

  Ref program_;
  PyThreadState* ts_ = nullptr;
};

TEST_F(CompatTest, TracingCounterReadsAndAddsTheInterpretersField) {
  EXPECT_EQ(compat::tracing_get(ts_), ts_->tracing);
  compat::tracing_add(ts_, 3);
  EXPECT_EQ(compat::tracing_get(ts_), 3);
  EXPECT_EQ(ts_->tracing, 3);
  compat::tracing_add(ts_, -3);
  EXPECT_EQ(compat::tracing_get(ts_), 0);
}

TEST_F(CompatTest, UseTracingSwitchIsIndependentOfTheCounterCallersSee) {
  compat::use_tracing_set(ts_, 0);
  compat::use_tracing_set(ts_, 0);  // a second "off" holds no second unit
  EXPECT_EQ(compat::use_tracing_get(ts_), 0);
  EXPECT_EQ(compat::tracing_get(ts_), 0);
  compat::tracing_add(ts_, 1);
  EXPECT_EQ(compat::tracing_get(ts_), 1);
  compat::tracing_add(ts_, -1);
  compat::use_tracing_set(ts_, 5);
  compat::use_tracing_set(ts_, 1);
  EXPECT_EQ(compat::tracing_get(ts_), 0);
  EXPECT_EQ(ts_->tracing, 0);
}

TEST_F(CompatTest, UseTracingGetSaysWhetherHooksWouldBeCalled) {
  EXPECT_EQ(compat::use_tracing_get(ts_), 0);  // no trace or profile function
  {
    coretest::TraceCounter counter;
    EXPECT_EQ(compat::use_tracing_get(ts_), 1);
    compat::tracing_add(ts_, 1);
    EXPECT_EQ(compat::use_tracing_get(ts_), 0);
    compat::tracing_add(ts_, -1);
    compat::use_tracing_set(ts_, 0);
    EXPECT_EQ(compat::use_tracing_get(ts_), 0);
    compat::use_tracing_set(ts_, 1);
    EXPECT_EQ(compat::use_tracing_get(ts_), 1);
  }
}

TEST_F(CompatTest, TracingCounterSilencesACTraceFunction) {
  coretest::TraceCounter counter("work");
  run_work();
  const int traced = counter.watched_events();
  EXPECT_GT(traced, 0);
  compat::tracing_add(ts_, 1);
  run_work();
  compat::tracing_add(ts_, -1);
  EXPECT_EQ(counter.watched_events(), traced);
  run_work();
  EXPECT_EQ(counter.watched_events(), 2 * traced);
}

TEST_F(CompatTest, TracingCounterSilencesASysSettraceFunction) {
  sys_settrace(coretest::item(program_.get(), "python_tracer"));
  compat::tracing_add(ts_, 1);
  run_work();
  compat::tracing_add(ts_, -1);
  const Py_ssize_t while_suspended = python_events();
  run_work();
  const Py_ssize_t after = python_events();
  sys_settrace(Py_None);
  EXPECT_EQ(while_suspended, 0);
  EXPECT_GT(after, 0);
}

TEST_F(CompatTest, UseTracingOffSilencesTracingUntilSwitchedOn) {
  coretest::TraceCounter counter("work");
  compat::use_tracing_set(ts_, 0);
  run_work();
  EXPECT_EQ(counter.watched_events(), 0);
  compat::use_tracing_set(ts_, 1);
  run_work();
  EXPECT_GT(counter.watched_events(), 0);
}

TEST_F(CompatTest, PendingErrorRoundTripsTheSameException) {
  PyErr_SetString(PyExc_LookupError, "held");
  Ref original = coretest::take_pending_exception();
  coretest::set_pending_exception(original.get());
  compat::PendingError saved;
  saved.fetch();
  EXPECT_EQ(PyErr_Occurred(), nullptr);
  EXPECT_FALSE(saved.empty());
  PyErr_SetString(PyExc_ValueError, "raised meanwhile");
  saved.restore();  // replaces what was raised meanwhile
  Ref back = coretest::take_pending_exception();
  EXPECT_TRUE(back.is(original.get()));
}

TEST_F(CompatTest, UseTracingSwitchBelongsToTheThreadStateNotTheOsThread) {
  // An OS thread may run several thread states one after another (PyGILState_Ensure and
  // Release from a C thread): the switch set in one must not show in the next.
  int first_off = -1, second_tracing = -1, second_raw = -1, second_use = -1;
  Py_BEGIN_ALLOW_THREADS std::thread worker([&] {
    PyGILState_STATE state = PyGILState_Ensure();
    PyThreadState* first = PyThreadState_Get();
    compat::use_tracing_set(first, 0);
    first_off = compat::use_tracing_get(first);
    PyGILState_Release(state);  // the thread state goes, still switched off
    state = PyGILState_Ensure();
    PyThreadState* second = PyThreadState_Get();
    second_tracing = compat::tracing_get(second);
    compat::use_tracing_set(second, 1);  // already on: nothing to undo
    second_raw = second->tracing;
    second_use = compat::use_tracing_get(second);
    PyGILState_Release(state);
  });
  worker.join();
  Py_END_ALLOW_THREADS EXPECT_EQ(first_off, 0);
  EXPECT_EQ(second_tracing, 0);
  EXPECT_EQ(second_raw, 0);
  EXPECT_EQ(second_use, 0);  // no trace function in the new thread state
}

TEST_F(CompatTest, TypeLookupFindsClassAttributesAlongTheMroAndNothingElse) {
  // The fast evaluation of conditions reads an instance attribute directly only when the
  // type has no attribute of that name; the look-up must see inherited ones and never an
  // instance's own.
  Ref ns = coretest::make_namespace(
      "class Base:\n    inherited = 1\nclass Child(Base):\n    pass\nobj = Child()\n"
      "obj.own = 2\n");
  auto* child = reinterpret_cast<PyTypeObject*>(coretest::item(ns.get(), "Child"));
  Ref inherited = Ref::steal(PyUnicode_FromString("inherited"));
  Ref own = Ref::steal(PyUnicode_FromString("own"));
  Ref real = Ref::steal(PyUnicode_FromString("real"));
  EXPECT_NE(compat::type_lookup(child, inherited.get()), nullptr);
  EXPECT_EQ(compat::type_lookup(child, own.get()), nullptr);
  EXPECT_NE(compat::type_lookup(&PyLong_Type, real.get()), nullptr);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

TEST_F(CompatTest, FrameLocalsProxyIsRecognisedWhereTheInterpreterAnswersOne) {
  Ref ns = coretest::make_namespace(
      "import sys\ndef f():\n    x = 1\n    return sys._getframe()\nframe = f()\n");
  auto* frame = reinterpret_cast<PyFrameObject*>(coretest::item(ns.get(), "frame"));
  Ref locals = Ref::steal(PyFrame_GetLocals(frame));
  ASSERT_TRUE(locals);
  EXPECT_EQ(compat::is_frame_locals_proxy(locals.get()), !PyDict_Check(locals.get()));
  // A plain dict is never the proxy (a static type's tp_dict is no dict to use here: it is
  // null from 3.12 on, where builtin types keep their dictionaries per interpreter).
  Ref plain = Ref::steal(PyDict_New());
  ASSERT_TRUE(plain);
  EXPECT_EQ(compat::is_frame_locals_proxy(plain.get()), false);
}

// What frame_fast_local answered for the names below, read by `probe` from inside the
// running frame (the hit test reads frames that run).
struct FastLocalReads {
  compat::FastLocal kind[6];
  PyObject* value[6];
};
FastLocalReads gReads;
constexpr const char* kReadNames[6] = {"plain", "arg", "other", "unbound", "cell", "sys"};

PyObject* probe(PyObject*, PyObject*) {
  PyFrameObject* frame = PyEval_GetFrame();  // borrowed: the calling Python frame
  for (int i = 0; i < 6; ++i) {
    Ref name = Ref::steal(PyUnicode_InternFromString(kReadNames[i]));
    gReads.value[i] = nullptr;
    gReads.kind[i] = compat::frame_fast_local(frame, name.get(), &gReads.value[i]);
  }
  Py_RETURN_NONE;
}

PyMethodDef gProbeDef = {"probe", probe, METH_NOARGS, nullptr};

TEST_F(CompatTest, FrameFastLocalReadsThePlainVariablesOfARunningFunctionFrame) {
  // The frame records' layout is the interpreter's own: a read that lands elsewhere answers
  // wrong values here (or unknown everywhere), not only on the version where it moved.
  Ref ns = coretest::make_namespace(
      "def f(arg, other='o'):\n"
      "    plain = 3\n"
      "    cell = 4\n"
      "    def inner():\n"
      "        return cell\n"
      "    probe()\n"
      "    return plain\n"
      "    unbound = 5\n");
  Ref function = Ref::steal(PyCFunction_New(&gProbeDef, nullptr));
  ASSERT_TRUE(function);
  ASSERT_EQ(PyDict_SetItemString(ns.get(), "probe", function.get()), 0);
  Ref one = Ref::steal(PyLong_FromLong(1));
  Ref result = Ref::steal(PyObject_CallOneArg(coretest::item(ns.get(), "f"), one.get()));
  ASSERT_TRUE(result);
#if PY_VERSION_HEX < 0x030D0000
  ASSERT_EQ(gReads.kind[0], compat::FastLocal::kValue);
  EXPECT_EQ(PyLong_AsLong(gReads.value[0]), 3);
  ASSERT_EQ(gReads.kind[1], compat::FastLocal::kValue);
  EXPECT_EQ(PyLong_AsLong(gReads.value[1]), 1);
  ASSERT_EQ(gReads.kind[2], compat::FastLocal::kValue);
  EXPECT_EQ(PyUnicode_CompareWithASCIIString(gReads.value[2], "o"), 0);
  EXPECT_EQ(gReads.kind[3], compat::FastLocal::kUnbound);
  EXPECT_EQ(gReads.kind[4], compat::FastLocal::kUnknown);  // a cell
  EXPECT_EQ(gReads.kind[5], compat::FastLocal::kUnknown);  // not a variable of f
#else
  EXPECT_EQ(gReads.kind[0], compat::FastLocal::kUnknown);
#endif
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

}  // namespace

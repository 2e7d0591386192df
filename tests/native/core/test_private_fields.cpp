// test_private_fields.cpp: every interpreter field the core reads directly, checked against
// what the public API or the Python level says on the interpreter the test embeds. A field
// that moves or changes meaning in a new CPython version fails here, by name, before the
// core misbehaves with it: the thread-state fields behind the accessors of pycompat.h, the
// frame type's f_trace descriptor, the code-object fields the name and dispatch code read,
// and the thread's recursion budget.
#include "support/pycompat.h"

#include <gtest/gtest.h>

#include <thread>
#include <vector>

#include "core_test_support.h"
#include "exc/opcodes.h"

namespace {

int trace_nothing(PyObject*, PyFrameObject*, int, PyObject*) {
  return 0;
}

unsigned long python_get_ident() {
  Ref threading = Ref::steal(PyImport_ImportModule("threading"));
  if (!threading) return 0;
  Ref ident = Ref::steal(PyObject_CallMethod(threading.get(), "get_ident", nullptr));
  return ident ? PyLong_AsUnsignedLong(ident.get()) : 0;
}

using PrivateFieldTest = coretest::PythonTest;

TEST_F(PrivateFieldTest, ThreadIdIsThreadingGetIdentInEveryThread) {
  PyThreadState* ts = PyThreadState_Get();
  EXPECT_EQ(compat::tstate_thread_id(ts), python_get_ident());
  EXPECT_EQ(compat::tstate_thread_id(ts), PyThread_get_thread_ident());
  unsigned long field = 0, from_python = 1;
  Py_BEGIN_ALLOW_THREADS std::thread worker([&] {
    PyGILState_STATE state = PyGILState_Ensure();
    field = compat::tstate_thread_id(PyThreadState_Get());
    from_python = python_get_ident();
    PyGILState_Release(state);
  });
  worker.join();
  Py_END_ALLOW_THREADS EXPECT_EQ(field, from_python);
  EXPECT_NE(field, compat::tstate_thread_id(ts));
}

TEST_F(PrivateFieldTest, TraceFieldsHoldWhatPyEvalSetTraceInstalled) {
  PyThreadState* ts = PyThreadState_Get();
  Ref marker = Ref::steal(PyList_New(0));
  ASSERT_TRUE(marker);
  EXPECT_EQ(compat::tstate_tracefunc(ts), nullptr);
  EXPECT_FALSE(compat::tstate_has_trace_or_profile(ts));

  PyEval_SetTrace(trace_nothing, marker.get());
  EXPECT_EQ(compat::tstate_tracefunc(ts), &trace_nothing);
  EXPECT_EQ(compat::tstate_traceobj(ts), marker.get());
  EXPECT_TRUE(compat::tstate_has_trace_or_profile(ts));
  PyEval_SetTrace(nullptr, nullptr);
  EXPECT_EQ(compat::tstate_tracefunc(ts), nullptr);
  EXPECT_EQ(compat::tstate_traceobj(ts), nullptr);
  EXPECT_FALSE(compat::tstate_has_trace_or_profile(ts));

  // A profile function alone also makes the interpreter call hooks in this thread.
  PyEval_SetProfile(trace_nothing, marker.get());
  EXPECT_EQ(compat::tstate_tracefunc(ts), nullptr);
  EXPECT_TRUE(compat::tstate_has_trace_or_profile(ts));
  PyEval_SetProfile(nullptr, nullptr);
  EXPECT_FALSE(compat::tstate_has_trace_or_profile(ts));
}

TEST_F(PrivateFieldTest, TracingFieldIsTheCounterOfEnterAndLeaveTracing) {
  PyThreadState* ts = PyThreadState_Get();
  const int before = compat::tracing_get(ts);
  PyThreadState_EnterTracing(ts);
  EXPECT_EQ(compat::tracing_get(ts), before + 1);
  PyThreadState_EnterTracing(ts);
  EXPECT_EQ(compat::tracing_get(ts), before + 2);
  PyThreadState_LeaveTracing(ts);
  PyThreadState_LeaveTracing(ts);
  EXPECT_EQ(compat::tracing_get(ts), before);
}

#if PY_VERSION_HEX < 0x030C0000
// 3.11 keeps a per-thread "use tracing" flag beside the counter; tracing_add recomputes it by
// the interpreter's rule, which must give what the interpreter itself sets.
TEST_F(PrivateFieldTest, UseTracingFlagFollowsTheInterpretersOwnRule) {
  PyThreadState* ts = PyThreadState_Get();
  PyEval_SetTrace(trace_nothing, Py_None);
  const int interpreter_on = ts->cframe->use_tracing;
  PyThreadState_EnterTracing(ts);
  const int interpreter_off = ts->cframe->use_tracing;
  PyThreadState_LeaveTracing(ts);
  EXPECT_NE(interpreter_on, interpreter_off);
  compat::tracing_add(ts, 1);
  EXPECT_EQ(ts->cframe->use_tracing, interpreter_off);
  compat::tracing_add(ts, -1);
  EXPECT_EQ(ts->cframe->use_tracing, interpreter_on);
  PyEval_SetTrace(nullptr, nullptr);
  EXPECT_EQ(ts->cframe->use_tracing, 0);
}
#endif

constexpr const char* kFrameProgram = R"(
def target():
    probe()
)";

TEST_F(PrivateFieldTest, FTraceDescriptorIsTheFrameTypesOwn) {
  // Without the descriptor the accessors fall back to attribute access and still work, so
  // its disappearance would only cost speed: this says so when it happens.
  PyGetSetDef* getset = compat::frame_f_trace_getset();
  ASSERT_NE(getset, nullptr);
  EXPECT_STREQ(getset->name, "f_trace");
  ASSERT_NE(getset->get, nullptr);
  ASSERT_NE(getset->set, nullptr);

  Ref globals = coretest::make_namespace(kFrameProgram);
  Ref marker = Ref::steal(PyList_New(0));
  bool ran = coretest::run_in_frame(globals.get(), "target", [&](PyFrameObject* frame) {
    PyObject* f = reinterpret_cast<PyObject*>(frame);
    ASSERT_EQ(compat::frame_set_trace(f, marker.get()), 0);
    Ref by_attribute = Ref::steal(PyObject_GetAttrString(f, "f_trace"));
    EXPECT_TRUE(by_attribute.is(marker.get()));
    Ref by_accessor = compat::frame_get_trace(f);
    EXPECT_TRUE(by_accessor.is(marker.get()));
    ASSERT_EQ(PyObject_SetAttrString(f, "f_trace", Py_None), 0);
    Ref cleared = compat::frame_get_trace(f);
    EXPECT_TRUE(cleared.is_none());
  });
  EXPECT_TRUE(ran);
}

TEST_F(PrivateFieldTest, CodeObjectFieldsAreTheAttributes) {
  Ref code =
      Ref::steal(Py_CompileString("def f(a):\n    return a + 12345\n", "<fields>", Py_file_input));
  ASSERT_TRUE(code);
  // The function's own code object is the first constant of the module's.
  Ref consts = Ref::steal(PyObject_GetAttrString(code.get(), "co_consts"));
  ASSERT_TRUE(consts);
  PyObject* fcode = PyTuple_GetItem(consts.get(), 0);
  ASSERT_TRUE(fcode != nullptr && PyCode_Check(fcode));
  auto* fields = reinterpret_cast<PyCodeObject*>(fcode);

  Ref name = Ref::steal(PyObject_GetAttrString(fcode, "co_name"));
  Ref filename = Ref::steal(PyObject_GetAttrString(fcode, "co_filename"));
  Ref fconsts = Ref::steal(PyObject_GetAttrString(fcode, "co_consts"));
  Ref flags = Ref::steal(PyObject_GetAttrString(fcode, "co_flags"));
  EXPECT_TRUE(name.is(fields->co_name));
  EXPECT_TRUE(filename.is(fields->co_filename));
  EXPECT_TRUE(fconsts.is(fields->co_consts));
  EXPECT_EQ(PyLong_AsLong(flags.get()), fields->co_flags);
  EXPECT_TRUE(fields->co_flags & CO_OPTIMIZED);  // a function's code
  EXPECT_FALSE(reinterpret_cast<PyCodeObject*>(code.get())->co_flags & CO_OPTIMIZED);
}

constexpr const char* kDepthProgram = R"(
import sys

def at_depth(n):
    if n:
        return at_depth(n - 1)
    probe()

def nest(n):
    return n == 0 or nest(n - 1)

def to_the_limit():
    try:
        to_the_limit()
    except RecursionError:
        probe()
)";

TEST_F(PrivateFieldTest, RecursionBudgetCountsPythonFrames) {
  Ref globals = coretest::make_namespace(kDepthProgram);
  PyThreadState* ts = PyThreadState_Get();
  const int before = compat::recursion_room_left(ts);
  std::vector<int> left;
  for (int depth : {0, 10, 30}) {
    Ref code = Ref::steal(PyUnicode_FromFormat("lambda: at_depth(%d)", depth));
    Ref fn = Ref::steal(
        PyRun_String(PyUnicode_AsUTF8(code.get()), Py_eval_input, globals.get(), globals.get()));
    ASSERT_TRUE(fn);
    PyDict_SetItemString(globals.get(), "run_it", fn.get());
    bool ran = coretest::run_in_frame(globals.get(), "run_it", [&](PyFrameObject*) {
      left.push_back(compat::recursion_room_left(ts));
    });
    ASSERT_TRUE(ran);
  }
  ASSERT_EQ(left.size(), 3u);
  {
    // Far from the limit a room adds nothing.
    compat::RecursionRoom room(50);
    EXPECT_EQ(compat::recursion_room_left(ts), before);
  }
  EXPECT_EQ(left[0] - left[1], 10);
  EXPECT_EQ(left[0] - left[2], 30);
  EXPECT_LT(left[0], Py_GetRecursionLimit());
  EXPECT_GT(left[0], Py_GetRecursionLimit() - 20);
}

TEST_F(PrivateFieldTest, RecursionRoomLetsNestedCallsRunAtTheLimitAndGivesItBack) {
  Ref globals = coretest::make_namespace(kDepthProgram);
  PyThreadState* ts = PyThreadState_Get();
  const int limit = Py_GetRecursionLimit();
  bool done = false;
  bool ran = coretest::run_in_frame(globals.get(), "to_the_limit", [&](PyFrameObject*) {
    if (done) return;
    done = true;
    PyObject* nest = coretest::item(globals.get(), "nest");
    const int left = compat::recursion_room_left(ts);
    EXPECT_LT(left, 10);
    Ref failed = Ref::steal(PyObject_CallFunction(nest, "i", 20));
    EXPECT_FALSE(failed) << "20 nested calls fit without room";
    EXPECT_TRUE(PyErr_ExceptionMatches(PyExc_RecursionError));
    PyErr_Clear();
    {
      compat::RecursionRoom room(50);
      EXPECT_GE(compat::recursion_room_left(ts), 50);
      Ref nested = Ref::steal(PyObject_CallFunction(nest, "i", 20));
      EXPECT_TRUE(nested) << "20 nested calls within the room";
      PyErr_Clear();
      EXPECT_EQ(Py_GetRecursionLimit(), limit);
    }
    EXPECT_EQ(compat::recursion_room_left(ts), left);
  });
  EXPECT_TRUE(ran && done);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

TEST_F(PrivateFieldTest, MethodDefinitionIsTheBuiltinFunctionsOwn) {
  Ref builtins = Ref::steal(PyImport_ImportModule("builtins"));
  ASSERT_TRUE(builtins);
  Ref len = Ref::steal(PyObject_GetAttrString(builtins.get(), "len"));
  ASSERT_TRUE(len);
  PyMethodDef* def = compat::method_def_of(len.get());
  ASSERT_NE(def, nullptr);
  EXPECT_STREQ(def->ml_name, "len");
  Ref again = Ref::steal(PyCFunction_NewEx(def, builtins.get(), nullptr));
  ASSERT_TRUE(again);
  EXPECT_EQ(PyObject_RichCompareBool(again.get(), len.get(), Py_EQ), 1);
  EXPECT_EQ(compat::method_def_of(builtins.get()), nullptr);
}

}  // namespace

// ---- The interpreter's frame records -----------------------------------------------------

namespace frames {

const char* const kSource = R"(
import contextlib

def direct():
    probe()

def python_caller():
    direct()

def key(item):
    probe()
    return item

def through_c():
    sorted([2, 1], key=key)

def in_suppress():
    with contextlib.suppress(KeyError):
        probe()

class Manager:
    def __enter__(self):
        return self
    def __exit__(self, *info):
        return False

manager = Manager()

def nested_in_loop():
    for _ in range(1):
        with manager:
            probe()
)";

// The depth of the exception-table entry that covers the frame's current instruction.
int handler_depth(PyFrameObject* frame) {
  Ref code = Ref::steal(reinterpret_cast<PyObject*>(PyFrame_GetCode(frame)));
  bytecode::TableEntry entry;
  if (!code ||
      !bytecode::find_handler(reinterpret_cast<PyCodeObject*>(code.get())->co_exceptiontable,
                              PyFrame_GetLasti(frame), &entry))
    return -1;
  return entry.depth;
}

}  // namespace frames

TEST_F(PrivateFieldTest, EntryFrameMarkTellsFramesCalledFromC) {
  ASSERT_EQ(bytecode::init_opcodes(), 0);
  Ref globals = coretest::make_namespace(frames::kSource);
  ASSERT_TRUE(globals);
  bool entered = false;
  // run_in_frame calls the function itself from C.
  ASSERT_TRUE(coretest::run_in_frame(globals.get(), "direct", [&](PyFrameObject* frame) {
    entered = compat::frame_entered_from_c(frame);
  }));
  EXPECT_TRUE(entered);
  ASSERT_TRUE(coretest::run_in_frame(globals.get(), "python_caller", [&](PyFrameObject* frame) {
    entered = compat::frame_entered_from_c(frame);
  }));
  EXPECT_FALSE(entered) << "a Python call counted as a call from C";
  ASSERT_TRUE(coretest::run_in_frame(globals.get(), "through_c", [&](PyFrameObject* frame) {
    entered = compat::frame_entered_from_c(frame);
  }));
  EXPECT_TRUE(entered) << "sorted() calling the key did not count as a call from C";
}

TEST_F(PrivateFieldTest, ValueStackHoldsTheExitOfTheRunningWithBlock) {
  ASSERT_EQ(bytecode::init_opcodes(), 0);
  Ref globals = coretest::make_namespace(frames::kSource);
  ASSERT_TRUE(globals);
  Ref contextlib = Ref::steal(PyImport_ImportModule("contextlib"));
  Ref suppress = Ref::steal(PyObject_GetAttrString(contextlib.get(), "suppress"));
  ASSERT_TRUE(suppress);
  PyObject* manager = nullptr;
  ASSERT_TRUE(coretest::run_in_frame(globals.get(), "in_suppress", [&](PyFrameObject* frame) {
    manager = compat::with_manager_of(frame, frames::handler_depth(frame));
    ASSERT_NE(manager, nullptr);
    EXPECT_EQ(reinterpret_cast<PyObject*>(Py_TYPE(manager)), suppress.get());
  }));
  // Below the with block the loop keeps its iterator: the exit is found above it.
  ASSERT_TRUE(coretest::run_in_frame(globals.get(), "nested_in_loop", [&](PyFrameObject* frame) {
    EXPECT_GE(frames::handler_depth(frame), 2);
    EXPECT_EQ(compat::with_manager_of(frame, frames::handler_depth(frame)),
              coretest::item(globals.get(), "manager"));
  }));
}

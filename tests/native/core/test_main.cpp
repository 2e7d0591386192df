// test_main.cpp: starts the embedded interpreter once for the process, sets the core up the
// way loading the extension module does, and holds the bodies of core_test_support.h.
#include <Python.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>

#include "core/tracercore.h"
#include "common/interpreter_main.h"
#include "core_test_support.h"
#include "support/dbgcommon.h"
#include "threads/threadops.h"

namespace coretest {

Ref take_pending_exception() {
#if PY_VERSION_HEX >= 0x030C0000
  return Ref::steal(PyErr_GetRaisedException());
#else
  PyObject *type = nullptr, *value = nullptr, *tb = nullptr;
  PyErr_Fetch(&type, &value, &tb);
  if (type == nullptr) return Ref();
  PyErr_NormalizeException(&type, &value, &tb);
  if (tb != nullptr) PyException_SetTraceback(value, tb);
  Py_XDECREF(type);
  Py_XDECREF(tb);
  return Ref::steal(value);
#endif
}

void set_pending_exception(PyObject* exc) {
#if PY_VERSION_HEX >= 0x030C0000
  PyErr_SetRaisedException(Py_NewRef(exc));
#else
  PyErr_Restore(Py_NewRef(reinterpret_cast<PyObject*>(Py_TYPE(exc))), Py_NewRef(exc),
                PyException_GetTraceback(exc));
#endif
}

namespace {

// The body that probe() runs; set only for the duration of run_in_frame.
const std::function<void(PyFrameObject*)>* gProbeBody = nullptr;
bool gProbeRan = false;

PyObject* probe(PyObject*, PyObject*) {
  if (gProbeBody != nullptr) {
    gProbeRan = true;
    (*gProbeBody)(PyEval_GetFrame());
  }
  // The body may leave an error pending on purpose; the Python caller then sees it raised.
  if (PyErr_Occurred() != nullptr) return nullptr;
  Py_RETURN_NONE;
}

PyObject* set_errno(PyObject*, PyObject* args) {
  int value = kClobberedErrno;
  if (!PyArg_ParseTuple(args, "|i:set_errno", &value)) return nullptr;
  errno = value;
  Py_RETURN_NONE;
}

PyMethodDef gProbeDef = {"probe", probe, METH_NOARGS, nullptr};
PyMethodDef gSetErrnoDef = {"set_errno", set_errno, METH_VARARGS, nullptr};

}  // namespace

Ref make_namespace(const std::string& source) {
  Ref globals = Ref::steal(PyDict_New());
  PyDict_SetItemString(globals.get(), "__builtins__", PyEval_GetBuiltins());
  Ref probe_fn = Ref::steal(PyCFunction_New(&gProbeDef, nullptr));
  Ref errno_fn = Ref::steal(PyCFunction_New(&gSetErrnoDef, nullptr));
  PyDict_SetItemString(globals.get(), "probe", probe_fn.get());
  PyDict_SetItemString(globals.get(), "set_errno", errno_fn.get());
  Ref code = Ref::steal(Py_CompileString(source.c_str(), "<core-test>", Py_file_input));
  Ref result = code ? Ref::steal(PyEval_EvalCode(code.get(), globals.get(), globals.get())) : Ref();
  if (!result) {
    PyErr_Print();
    ADD_FAILURE() << "could not run:\n" << source;
  }
  return globals;
}

bool run_in_frame(PyObject* globals, const char* function_name,
                  const std::function<void(PyFrameObject*)>& body) {
  PyObject* function = item(globals, function_name);
  if (function == nullptr) return false;
  gProbeBody = &body;
  gProbeRan = false;
  Ref result = Ref::steal(PyObject_CallNoArgs(function));
  gProbeBody = nullptr;
  if (!result) {
    PyErr_Print();
    ADD_FAILURE() << function_name << "() raised";
  }
  return gProbeRan;
}

PyObject* item(PyObject* globals, const char* name) {
  PyObject* value = PyDict_GetItemString(globals, name);
  EXPECT_NE(value, nullptr) << name << " missing from the test namespace";
  return value;
}

TraceCounter::TraceCounter(const char* watched_code_name) : watched_(watched_code_name) {
  Ref self = Ref::steal(PyCapsule_New(this, nullptr, nullptr));
  PyEval_SetTrace(trace, self.get());
}

TraceCounter::~TraceCounter() {
  PyEval_SetTrace(nullptr, nullptr);
}

int TraceCounter::trace(PyObject* obj, PyFrameObject* frame, int, PyObject*) {
  auto* self = static_cast<TraceCounter*>(PyCapsule_GetPointer(obj, nullptr));
  ++self->events_;
  Ref code = Ref::steal(reinterpret_cast<PyObject*>(PyFrame_GetCode(frame)));
  const char* name = PyUnicode_AsUTF8(reinterpret_cast<PyCodeObject*>(code.get())->co_name);
  if (name != nullptr && self->watched_ == name) ++self->watched_events_;
  return 0;
}

void PythonTest::SetUp() {
  ASSERT_EQ(PyErr_Occurred(), nullptr);
  ASSERT_EQ(PyThreadState_Get()->c_tracefunc, nullptr);
}

void PythonTest::TearDown() {
  if (PyErr_Occurred() != nullptr) {
    PyErr_Print();
    ADD_FAILURE() << "a Python error was left pending";
  }
  if (PyThreadState_Get()->c_tracefunc != nullptr) {
    PyEval_SetTrace(nullptr, nullptr);
    ADD_FAILURE() << "a trace function was left installed";
  }
}

}  // namespace coretest

namespace {

// What loading the extension module does before any method can run, beyond the string makers.
void prepare_core() {
  init_threadops();
  ASSERT_EQ(init_tracercore(), 0);
}

}  // namespace

int main(int argc, char** argv) {
  return nativetest::run_tests_with_interpreter(argc, argv, prepare_core);
}

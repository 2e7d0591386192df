// core_test_support.h: helpers shared by the core's tests that embed the interpreter.
//
// The interpreter is started once per process by test_main.cpp, which also sets the core up
// as module load does. What the tests need beyond that: a namespace of Python helpers (a C
// probe that runs test code inside a real Python frame, a C function that clobbers errno,
// a counting C trace function), a capture of the debug print channel, and access to the
// pending exception as one object on every interpreter.
#pragma once

#include "common/debug_capture.h"

#include <Python.h>
#include <frameobject.h>
#include <gtest/gtest.h>

#include <functional>
#include <string>

#include "support/dprintf.h"
#include "support/ref.h"

namespace coretest {

// The errno value that the helper `set_errno` of the test namespace writes by default, and
// the value tests put into errno before a call to see that it survives.
constexpr int kClobberedErrno = 9876;
constexpr int kMarkerErrno = 4242;

// Reference count as a plain number, for before/after comparisons.
inline Py_ssize_t refs(PyObject* obj) {
  return Py_REFCNT(obj);
}

// Takes the pending exception out of the thread as one normalised instance (new reference);
// a null Ref when nothing is pending.
Ref take_pending_exception();

// Makes `exc` (an instance) the pending exception again, as take_pending_exception found it.
void set_pending_exception(PyObject* exc);

// A module namespace holding builtins and the test's C helpers:
//   probe()          runs the body given to run_in_frame with the caller's frame;
//   set_errno(n=...) sets the C errno (to kClobberedErrno without an argument);
// then `source` is run in it. Fails the test (and returns what it has) on a Python error.
Ref make_namespace(const std::string& source);

// Calls globals[function_name]() and, when that Python function calls probe(), runs `body`
// with the frame that called probe() (borrowed). Returns whether the body ran.
bool run_in_frame(PyObject* globals, const char* function_name,
                  const std::function<void(PyFrameObject*)>& body);

// globals[name] borrowed, failing the test when missing.
PyObject* item(PyObject* globals, const char* name);

// Counts the events of a C trace function installed with PyEval_SetTrace for its scope, by
// event kind and for one code name.
class TraceCounter {
 public:
  explicit TraceCounter(const char* watched_code_name = "");
  ~TraceCounter();
  TraceCounter(const TraceCounter&) = delete;
  TraceCounter& operator=(const TraceCounter&) = delete;

  int events() const { return events_; }
  int watched_events() const { return watched_events_; }

 private:
  static int trace(PyObject* obj, PyFrameObject* frame, int what, PyObject* arg);
  std::string watched_;
  int events_ = 0;
  int watched_events_ = 0;
};

using nativetest::DebugCapture;

// Every test starts and ends with no Python error pending and no trace function installed.
class PythonTest : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;
};

}  // namespace coretest

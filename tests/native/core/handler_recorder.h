// handler_recorder.h: runs a Python function under a C trace function that asks the handler
// analysis about every exception when it is first raised, and records the answers next to
// what really happened to the exception.
#pragma once

#include <Python.h>
#include <frameobject.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "exc/handlers.h"
#include "support/ref.h"

namespace coretest {

// The analysis's answers for one exception object, taken at its first exception event.
struct RaiseAnswers {
  std::string where;  // name of the code that raised it
  std::string type;   // its class name
  std::string tag;    // str(args[0]) when it has arguments
  int handled[3] = {-1, -1, -1};     // __tracer_exc_handled, all frames, match kinds 0..2
  int this_frame[3] = {-1, -1, -1};  // the same for the raising frame only
  int stop_iter = -1;                // exc_stop_iter_handled in the raising frame
  int active = -1;                   // frame_has_active_handler of the raising frame
  int pending_after = 0;             // an error was pending after the questions
  bool escaped = false;              // it is the exception that left the called function
  Ref exc;                           // the exception object
};

// Runs globals[function]() traced. `ignored` (borrowed, may be null) is handed to the
// analysis as the ignored-handlers dictionary.
class HandlerRecorder {
 public:
  explicit HandlerRecorder(PyObject* ignored = nullptr) : ignored_(ignored) {}

  // Calls the function; returns false when it raised (the error is cleared and the
  // matching record marked as escaped).
  bool run(PyObject* globals, const char* function) {
    PyObject* callable = PyDict_GetItemString(globals, function);
    EXPECT_NE(callable, nullptr) << function;
    if (callable == nullptr) return false;
    Ref self = Ref::steal(PyCapsule_New(this, nullptr, nullptr));
    PyEval_SetTrace(trace, self.get());
    Ref result = Ref::steal(PyObject_CallNoArgs(callable));
    PyEval_SetTrace(nullptr, nullptr);
    if (result) return true;
    PyObject *type = nullptr, *value = nullptr, *tb = nullptr;
    PyErr_Fetch(&type, &value, &tb);
    PyErr_NormalizeException(&type, &value, &tb);
    for (auto& raise : raises_) {
      if (raise.exc.is(value)) raise.escaped = true;
    }
    Py_XDECREF(type);
    Py_XDECREF(value);
    Py_XDECREF(tb);
    return false;
  }

  const std::vector<RaiseAnswers>& raises() const { return raises_; }

  // The first record whose tag or type name is `key`; fails the test when there is none.
  const RaiseAnswers& find(const std::string& key) const {
    for (const auto& raise : raises_) {
      if (raise.tag == key || raise.type == key) return raise;
    }
    ADD_FAILURE() << "no exception " << key << " was raised";
    static const RaiseAnswers kNone;
    return kNone;
  }

 private:
  static int trace(PyObject* self, PyFrameObject* frame, int what, PyObject* arg) {
    if (what != PyTrace_EXCEPTION || !PyTuple_Check(arg) || PyTuple_GET_SIZE(arg) < 2) return 0;
    auto* recorder = static_cast<HandlerRecorder*>(PyCapsule_GetPointer(self, nullptr));
    recorder->record(frame, PyTuple_GET_ITEM(arg, 1));
    return 0;
  }

  void record(PyFrameObject* frame, PyObject* exc) {
    for (const auto& raise : raises_) {
      if (raise.exc.is(exc)) return;  // already asked at its first event
    }
    RaiseAnswers answers;
    answers.exc = Ref::borrow(exc);
    auto* f = reinterpret_cast<PyObject*>(frame);
    for (int kind = 0; kind < 3; ++kind) {
      answers.handled[kind] = __tracer_exc_handled(f, ignored_, exc, kind, 0);
      answers.this_frame[kind] = __tracer_exc_handled(f, ignored_, exc, kind, 1);
    }
    answers.stop_iter = exc_stop_iter_handled(f, exc);
    answers.active = frame_has_active_handler(f);
    answers.pending_after = PyErr_Occurred() != nullptr;
    PyErr_Clear();
    Ref code = Ref::steal(reinterpret_cast<PyObject*>(PyFrame_GetCode(frame)));
    answers.where = PyUnicode_AsUTF8(reinterpret_cast<PyCodeObject*>(code.get())->co_name);
    answers.type = Py_TYPE(exc)->tp_name;
    Ref args = Ref::steal(PyObject_GetAttrString(exc, "args"));
    if (args && PyTuple_Check(args.get()) && PyTuple_GET_SIZE(args.get()) > 0) {
      Ref text = Ref::steal(PyObject_Str(PyTuple_GET_ITEM(args.get(), 0)));
      const char* utf8 = text ? PyUnicode_AsUTF8(text.get()) : nullptr;
      if (utf8 != nullptr) answers.tag = utf8;
    }
    PyErr_Clear();
    raises_.push_back(std::move(answers));
  }

  PyObject* ignored_;
  std::vector<RaiseAnswers> raises_;
};

}  // namespace coretest

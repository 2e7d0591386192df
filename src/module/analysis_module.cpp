// analysis_module.cpp: the submodule tvantrel30pydebugstackless.analysis, made with the main
// module. It holds the project's own entry points beyond the main module's fixed method table:
// the exception prediction the stop decision uses, asked by the server side for what it shows,
// and the setting that tells the program's own code from library code.
#include <Python.h>
#include <frameobject.h>

#include "core/tracercore.h"
#include "exc/handlers.h"
#include "exc/usercode.h"
#include "module/methods.h"
#include "support/pycompat.h"
#include "threads/threadops.h"

namespace {

const char* kind_name(CatchKind kind) {
  switch (kind) {
    case CatchKind::kCaught:
      return "caught";
    case CatchKind::kCCode:
      return "c-code";
    case CatchKind::kWith:
      return "with";
    case CatchKind::kUncaught:
      break;
  }
  return "uncaught";
}

PyObject* prediction_tuple(const CatchPrediction& prediction) {
  if (prediction.kind == CatchKind::kUncaught || !prediction.frame)
    return Py_BuildValue("(sOOi)", "uncaught", Py_None, Py_None, 0);
  auto* frame = reinterpret_cast<PyFrameObject*>(prediction.frame.get());
  Ref code = Ref::steal(reinterpret_cast<PyObject*>(PyFrame_GetCode(frame)));
  if (!code) return nullptr;
  PyObject* filename = reinterpret_cast<PyCodeObject*>(code.get())->co_filename;
  return Py_BuildValue("(sOOi)", kind_name(prediction.kind), prediction.frame.get(), filename,
                       catch_prediction_line(prediction));
}

bool check_arguments(PyObject* frame, PyObject* exc, PyObject* ignored) {
  if (!compat::is_plain_frame(frame)) {
    PyErr_Format(PyExc_TypeError, "predict_catch() argument 'frame' must be a frame, not %.100s",
                 Py_TYPE(frame)->tp_name);
    return false;
  }
  if (!PyExceptionInstance_Check(exc) && !PyExceptionClass_Check(exc)) {
    PyErr_Format(PyExc_TypeError,
                 "predict_catch() argument 'exc' must be an exception or an exception class, "
                 "not %.100s",
                 Py_TYPE(exc)->tp_name);
    return false;
  }
  if (ignored != Py_None && !PyDict_Check(ignored)) {
    PyErr_Format(PyExc_TypeError,
                 "predict_catch() argument 'ignored_handlers' must be a dict or None, not %.100s",
                 Py_TYPE(ignored)->tp_name);
    return false;
  }
  return true;
}

// The walk ends at the thread's bottom frame, as the stop decision's does; a frame that an
// exception is leaving right now (a stop made as it is left) has had its handlers' turn.
void describe_thread(PyObject* frame, CatchQuestion* question) {
  ThreadData* data = get_current_thread_data(&gSelf.thread_table);
  if (data == nullptr) return;
  if (data->bot_frame && !data->bot_frame.is_none()) question->outermost = data->bot_frame.get();
  question->leaving_frame = data->exception_leaving_frame == frame;
}

PyObject* predict_catch_method(PyObject*, PyObject* args, PyObject* kwargs) {
  static const char* keywords[] = {"frame", "exc", "ignored_handlers", nullptr};
  PyObject* frame = nullptr;
  PyObject* exc = nullptr;
  PyObject* ignored = Py_None;
  if (!PyArg_ParseTupleAndKeywords(args, kwargs, "OO|O:predict_catch", const_cast<char**>(keywords),
                                   &frame, &exc, &ignored) ||
      !check_arguments(frame, exc, ignored)) {
    return nullptr;
  }
  CatchQuestion question;
  question.frame = frame;
  question.exc = exc;
  question.ignored_handlers = ignored == Py_None ? gSelf.ignored_exception_handlers.get() : ignored;
  describe_thread(frame, &question);
  return prediction_tuple(predict_catch(question));
}

PyObject* set_user_code_method(PyObject*, PyObject* args, PyObject* kwargs) {
  static const char* keywords[] = {"library_prefixes", nullptr};
  PyObject* prefixes = nullptr;
  if (!PyArg_ParseTupleAndKeywords(args, kwargs, "O:set_user_code", const_cast<char**>(keywords),
                                   &prefixes) ||
      set_library_prefixes(&gSelf.user_code, prefixes) != 0) {
    return nullptr;
  }
  Py_RETURN_NONE;
}

PyObject* get_user_code_method(PyObject*, PyObject*) {
  return library_prefixes(&gSelf.user_code);
}

PyObject* is_library_code_method(PyObject*, PyObject* frame) {
  if (!compat::is_plain_frame(frame)) {
    PyErr_Format(PyExc_TypeError, "is_library_code() argument must be a frame, not %.100s",
                 Py_TYPE(frame)->tp_name);
    return nullptr;
  }
  return PyBool_FromLong(frame_is_library_code(&gSelf.user_code, frame) ? 1 : 0);
}

PyCFunction keywords_method(PyObject* (*fn)(PyObject*, PyObject*, PyObject*)) {
  return reinterpret_cast<PyCFunction>(reinterpret_cast<void (*)()>(fn));
}

PyMethodDef gAnalysisMethods[] = {
    {"predict_catch", keywords_method(predict_catch_method), METH_VARARGS | METH_KEYWORDS,
     "predict_catch(frame, exc, ignored_handlers=None) -> (kind, frame, filename, lineno)\n\n"
     "What will become of the exception `exc` (an instance or a class) that is now in `frame`:\n"
     "'caught' by an except clause (or the interpreter) of the returned frame at filename:lineno;\n"
     "'c-code': C code called from the returned frame at filename:lineno may end it;\n"
     "'with': the exit of a with block at filename:lineno of the returned frame may suppress it;\n"
     "'uncaught': nothing catches it (None, None, 0).\n"
     "ignored_handlers: a dict with code objects or frames as keys whose handlers are passed\n"
     "over; None uses the one set with set_ignored_exception_handlers."},
    {"set_user_code", keywords_method(set_user_code_method), METH_VARARGS | METH_KEYWORDS,
     "set_user_code(library_prefixes)\n\n"
     "Path prefixes (a sequence of str) of library code: code whose file name begins with one\n"
     "of them (or a module frozen into the interpreter) is library code, all other code is the\n"
     "program's own. Used by exception mode 3 (user-unhandled). Replaces the prefixes set\n"
     "before; an empty sequence forgets them."},
    {"get_user_code", get_user_code_method, METH_NOARGS,
     "get_user_code() -> tuple of the library path prefixes in force."},
    {"is_library_code", is_library_code_method, METH_O,
     "is_library_code(frame) -> whether the frame runs library code (see set_user_code)."},
    {nullptr, nullptr, 0, nullptr},
};

PyModuleDef gAnalysisDef = {
    PyModuleDef_HEAD_INIT,
    "tvantrel30pydebugstackless.analysis",
    "The debugger core's exception analysis and its settings, beyond the main module's methods.",
    -1,
    gAnalysisMethods,
    nullptr,
    nullptr,
    nullptr,
    nullptr,
};

}  // namespace

int add_analysis_module(PyObject* parent) {
  return add_submodule(parent, &gAnalysisDef);
}

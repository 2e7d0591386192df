// breakpoints_module.cpp: the submodule tvantrel30pydebugstackless.breakpoints, made with the
// main module: the breakpoint entry points of the core beyond the main module's methods.
#include "bp/condition.h"
#include "bp/fastcond.h"
#include "module/methods.h"
#include "support/ref.h"

namespace {

PyObject* answer_object(int answer) {
  if (answer < 0) Py_RETURN_NONE;
  return PyBool_FromLong(answer);
}

// condition_answers(cond, frame): what the hit test's evaluation answers for a condition in
// a frame, and what the fast path answers on its own.
PyObject* condition_answers(PyObject*, PyObject* args) {
  const char* text = nullptr;
  PyObject* frame = nullptr;
  if (!PyArg_ParseTuple(args, "sO!:condition_answers", &text, &PyFrame_Type, &frame)) {
    return nullptr;
  }
  auto* f = reinterpret_cast<PyFrameObject*>(frame);
  std::shared_ptr<const CompiledCondition> condition = condition_compile(text);
  int fast = condition->fast ? fast_condition_evaluate(*condition->fast, f) : kFastUndecided;
  int full = condition_evaluate(*condition, f);
  PyErr_Clear();  // the evaluation's own error is dropped, as in the hit test
  return Py_BuildValue("(NN)", answer_object(fast == kFastUndecided ? -1 : fast),
                       answer_object(full));
}

PyMethodDef gBreakpointsMethods[] = {
    {"condition_answers", condition_answers, METH_VARARGS,
     "condition_answers(cond, frame) -> (fast, full)\n\n"
     "How the hit test evaluates the condition text in the frame. `full` is its answer: True\n"
     "or False, or None when the condition cannot be evaluated (it then stops). `fast` is the\n"
     "answer of the evaluation without the interpreter's eval loop alone, or None when that\n"
     "does not answer for this condition and these values."},
    {nullptr, nullptr, 0, nullptr},
};

PyModuleDef gBreakpointsDef = {
    PyModuleDef_HEAD_INIT,
    "tvantrel30pydebugstackless.breakpoints",
    "The debugger core's breakpoint entry points, beyond the main module's methods.",
    -1,
    gBreakpointsMethods,
    nullptr,
    nullptr,
    nullptr,
    nullptr,
};

}  // namespace

int add_breakpoints_module(PyObject* parent) {
  return add_submodule(parent, &gBreakpointsDef);
}

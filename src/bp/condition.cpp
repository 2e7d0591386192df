// condition.cpp: compiling a breakpoint condition once and evaluating it (see condition.h).
//
// Evaluation must look as if the text were evaluated afresh in the frame at that moment:
// the frame's globals, a snapshot of its locals, nothing written back. Compiling is what
// cost most per pass, then copying every local into a fresh dictionary; both are now done
// only as far as the code needs them.
#include "bp/condition.h"

#include <cstring>

#include "bp/fastcond.h"

namespace {

// Names whose use means the condition may look at its namespace as a whole or reach frames:
// it then gets a copy of every local, not only of the names it reads.
constexpr const char* kIntrospectiveNames[] = {
    "locals", "vars",     "dir",      "eval",     "exec",     "_getframe", "currentframe",
    "f_back", "f_locals", "tb_frame", "gi_frame", "cr_frame", "ag_frame"};

bool is_introspective(PyObject* name) {
  if (!PyUnicode_Check(name)) return true;
  for (const char* known : kIntrospectiveNames) {
    if (PyUnicode_CompareWithASCIIString(name, known) == 0) return true;
  }
  return false;
}

// Whether `code` or a code object nested in it uses an introspective name. Answers true when
// it cannot tell (the safe side: the whole namespace is copied).
bool uses_introspection(PyObject* code, int depth) {
  Ref names = Ref::steal(PyObject_GetAttrString(code, "co_names"));
  Ref consts = Ref::steal(PyObject_GetAttrString(code, "co_consts"));
  if (!names || !consts || !PyTuple_Check(names.get()) || !PyTuple_Check(consts.get()) ||
      depth > 50) {
    PyErr_Clear();
    return true;
  }
  for (Py_ssize_t i = 0; i < PyTuple_GET_SIZE(names.get()); ++i) {
    if (is_introspective(PyTuple_GET_ITEM(names.get(), i))) return true;
  }
  for (Py_ssize_t i = 0; i < PyTuple_GET_SIZE(consts.get()); ++i) {
    PyObject* item = PyTuple_GET_ITEM(consts.get(), i);
    if (PyCode_Check(item) && uses_introspection(item, depth + 1)) return true;
  }
  return false;
}

// The value of `name` in a locals mapping (a dictionary, or a frame's write-through proxy),
// or a null Ref when it has none; false when looking raised anything but KeyError.
bool lookup_local(PyObject* locals, PyObject* name, Ref& value) {
  if (PyDict_CheckExact(locals)) {
    value = Ref::borrow(PyDict_GetItemWithError(locals, name));
    return value || PyErr_Occurred() == nullptr;
  }
  value = Ref::steal(PyObject_GetItem(locals, name));
  if (value || !PyErr_ExceptionMatches(PyExc_KeyError)) return bool(value);
  PyErr_Clear();
  return true;
}

// A new dictionary with the current values of the names the condition reads.
Ref copy_read_names(const CompiledCondition& condition, PyObject* locals) {
  Ref copy = Ref::steal(PyDict_New());
  if (!copy) return copy;
  PyObject* names = condition.names.get();
  for (Py_ssize_t i = 0; i < PyTuple_GET_SIZE(names); ++i) {
    PyObject* name = PyTuple_GET_ITEM(names, i);
    Ref value;
    if (!lookup_local(locals, name, value)) return Ref();
    if (value && PyDict_SetItem(copy.get(), name, value.get()) != 0) return Ref();
  }
  return copy;
}

bool is_function_frame(PyFrameObject* frame) {
  Ref code = Ref::steal(reinterpret_cast<PyObject*>(PyFrame_GetCode(frame)));
  return (reinterpret_cast<PyCodeObject*>(code.get())->co_flags & CO_OPTIMIZED) != 0;
}

// The locals the condition is evaluated with: the current values of the frame's variables,
// never written back. From 3.13 on a function frame's f_locals is a write-through proxy
// (earlier, a dictionary the interpreter fills from the fast locals), so a function frame's
// condition always gets a dictionary of its own. Module-level code and class bodies have no
// fast locals: their namespace is used as it is, unless the condition could bind a name in
// it.
Ref condition_locals(const CompiledCondition& condition, PyFrameObject* frame) {
  bool function = is_function_frame(frame);
  if (!function && !condition.can_store) return Ref::steal(PyFrame_GetLocals(frame));
  // A condition that reads no name reads no local: the frame's locals are not even made.
  if (PyTuple_GET_SIZE(condition.names.get()) == 0 && !condition.reads_all) {
    return Ref::steal(PyDict_New());
  }
  Ref locals = Ref::steal(PyFrame_GetLocals(frame));
  if (!locals) return locals;
  if (!condition.reads_all) return copy_read_names(condition, locals.get());
  Ref copy = Ref::steal(PyDict_New());
  if (!copy || PyDict_Update(copy.get(), locals.get()) != 0) return Ref();
  return copy;
}

}  // namespace

std::shared_ptr<const CompiledCondition> condition_compile(const char* text) {
  auto condition = std::make_shared<CompiledCondition>();
  // The file name an evaluated text has always had in tracebacks and warnings.
  condition->code = Ref::steal(Py_CompileString(text, "<string>", Py_eval_input));
  if (condition->code)
    condition->names = Ref::steal(PyObject_GetAttrString(condition->code.get(), "co_names"));
  if (!condition->names || !PyTuple_Check(condition->names.get())) {
    condition->code.reset();
    condition->names.reset();
    PyErr_Clear();
    return condition;
  }
  // Only an assignment expression binds a name in an expression (comprehension variables
  // live in their own scope). Found in the text, so a ":=" in a string literal merely costs
  // a copy.
  condition->can_store = std::strstr(text, ":=") != nullptr;
  condition->reads_all = uses_introspection(condition->code.get(), 0);
  condition->fast = fast_condition_parse(text);
  PyErr_Clear();
  return condition;
}

int condition_evaluate(const CompiledCondition& condition, PyFrameObject* frame) {
  if (!condition.code) return -1;  // does not compile: stops every time
  if (condition.fast) {
    int answer = fast_condition_evaluate(*condition.fast, frame);
    if (answer != kFastUndecided) return answer;
  }
  Ref locals = condition_locals(condition, frame);
  Ref globals = Ref::steal(PyFrame_GetGlobals(frame));
  if (!locals || !globals) return -1;
  Ref result = Ref::steal(PyEval_EvalCode(condition.code.get(), globals.get(), locals.get()));
  int truth = result ? PyObject_IsTrue(result.get()) : -1;
  return truth < 0 ? -1 : truth;
}

// handlers.cpp: the handler analysis. See handlers.h for what it answers; exc/opcodes.h
// supplies the interpreter's vocabulary and the decoders.
//
// Shapes read at a handler target (offsets in bytes of co_code):
//   PUSH_EXC_INFO; POP_TOP                                  bare `except:`
//   PUSH_EXC_INFO; WITH_EXCEPT_START                        with / async with exit
//   PUSH_EXC_INFO; {loads}; CHECK_EXC_MATCH; JF next        except chain (JF = the forward
//        next: another clause | POP_TOP (bare) | RERAISE     jump-if-false of the version)
//   PUSH_EXC_INFO; prologue with BUILD_LIST 0; {loads};      except* chain, clauses linked by
//        CHECK_EG_MATCH; COPY 1; JN next                     the forward jump-if-None
//        next: POP_TOP, then another clause | LIST_APPEND
//   END_ASYNC_FOR                                           end of `async for`
//   PUSH_EXC_INFO; anything else                            finally body: not catching
//   anything else                                           compiler cleanup: not catching
// A class expression is accepted only when it consists of pure loads (names, constants,
// locals, attributes, one final tuple); it is checked before any of it is evaluated, so a
// finally body or an unknown shape never runs user code. Loads from closure cells count as
// unknown on purpose.
#include "exc/handlers.h"

#include <frameobject.h>

#include <array>
#include <cerrno>

#include "exc/opcodes.h"
#include "support/dbgcommon.h"
#include "support/dprintf.h"
#include "support/pycompat.h"
#include "support/ref.h"

using bytecode::Instr;
using bytecode::Op;
using bytecode::TableEntry;

namespace {

// The interpreter's PyFrame_GetVar where it has one (3.12+), found at load; without it a
// local is read through the frame's locals mapping.
PyObject* (*gFrameGetVar)(PyFrameObject*, PyObject*) = nullptr;

// Bounds that keep a malformed or adversarial code object from making the analysis loop:
// far above anything a compiler emits for one clause or one nest of handlers.
constexpr int kMaxValues = 32;        // values of one class expression (or of all except*)
constexpr int kMaxClauseSteps = 256;  // instructions of one class expression
constexpr int kMaxClauses = 256;      // clauses of one chain
constexpr int kMaxHandlerHops = 256;  // nested handlers of one frame
constexpr int kMaxGroupDepth = 32;    // nesting of exception groups

const bytecode::Opcodes& table() {
  return bytecode::opcodes();
}
bool is(int op, Op role) {
  return op == table().op[role];
}

// The question asked: the exception, its class and the kind of match.
struct Query {
  PyObject* exc;   // borrowed: instance or class
  PyObject* type;  // borrowed
  int kind;
};

// Keeps the thread's pending exception and errno across the analysis, which may run Python
// code (a property, a module __getattr__) and clears every error it meets.
class KeepThreadState {
 public:
  KeepThreadState() : errno_(errno) { saved_.fetch(); }
  ~KeepThreadState() {
    PyErr_Clear();
    saved_.restore();
    errno = errno_;
  }
  KeepThreadState(const KeepThreadState&) = delete;
  KeepThreadState& operator=(const KeepThreadState&) = delete;

 private:
  compat::PendingError saved_;
  int errno_;
};

// The code a frame runs, held for the analysis of that frame.
class FrameCode {
 public:
  bool open(PyFrameObject* frame) {
    code_ = Ref::steal(reinterpret_cast<PyObject*>(PyFrame_GetCode(frame)));
    if (!code_) return false;
    co_code_ = Ref::steal(PyCode_GetCode(co()));
    if (!co_code_ || !PyBytes_Check(co_code_.get())) {
      PyErr_Clear();
      return false;
    }
    bytes_ = reinterpret_cast<const uint8_t*>(PyBytes_AS_STRING(co_code_.get()));
    size_ = static_cast<int>(PyBytes_GET_SIZE(co_code_.get()));
    return true;
  }
  PyCodeObject* co() const { return reinterpret_cast<PyCodeObject*>(code_.get()); }
  PyObject* exception_table() const { return co()->co_exceptiontable; }
  bool decode(int offset, Instr* out) const {
    return bytecode::decode_at(bytes_, size_, offset, out);
  }
  // The opcode of the instruction that `offset` belongs to (callers may stand in caches).
  int opcode_around(int offset) const {
    int start = bytecode::instruction_start(bytes_, size_, offset);
    Instr ins;
    return start >= 0 && decode(start, &ins) ? ins.op : -1;
  }
  int size() const { return size_; }

 private:
  Ref code_;     // the frame's code object
  Ref co_code_;  // its de-optimised byte code
  const uint8_t* bytes_ = nullptr;
  int size_ = 0;
};

// The frame's namespaces, fetched on first use.
class Namespaces {
 public:
  explicit Namespaces(PyFrameObject* frame) : frame_(frame) {}

  PyObject* locals() {
    if (!locals_) locals_ = Ref::steal(PyFrame_GetLocals(frame_));
    return locals_.get();
  }
  PyObject* globals() {
    if (!globals_) globals_ = Ref::steal(PyFrame_GetGlobals(frame_));
    return globals_.get();
  }
  PyObject* builtins() {
    if (!builtins_) builtins_ = Ref::steal(PyFrame_GetBuiltins(frame_));
    return builtins_.get();
  }
  PyFrameObject* frame() const { return frame_; }

 private:
  PyFrameObject* frame_;  // borrowed for the analysis
  Ref locals_;
  Ref globals_;
  Ref builtins_;
};

// ---- Evaluating a class expression ----------------------------------------------------------

// mapping[name] the way the interpreter's name lookups do it: dicts directly, other mappings
// through __getitem__. Null when missing; `failed` is set when the lookup raised something
// other than KeyError (the error stays pending for the caller to clear).
Ref lookup_name(PyObject* mapping, PyObject* name, bool* failed) {
  if (mapping == nullptr) {
    *failed = PyErr_Occurred() != nullptr;
    return Ref();
  }
  if (PyDict_CheckExact(mapping)) {
    PyObject* value = PyDict_GetItemWithError(mapping, name);  // borrowed
    if (value == nullptr && PyErr_Occurred()) *failed = true;
    return Ref::borrow(value);
  }
  Ref value = Ref::steal(PyObject_GetItem(mapping, name));
  if (!value) {
    if (PyErr_ExceptionMatches(PyExc_KeyError))
      PyErr_Clear();
    else
      *failed = true;
  }
  return value;
}

// First hit of `name` in the given namespaces, in order. Null when a lookup failed or the
// name is nowhere (the interpreter would raise NameError: the clause then cannot match).
template <typename... Spaces>
Ref lookup_chain(PyObject* name, Spaces... spaces) {
  for (PyObject* space : {spaces...}) {
    bool failed = false;
    Ref value = lookup_name(space, name, &failed);
    if (value || failed) return value;
  }
  return Ref();
}

// The value of local slot `index` (co_varnames, then cells, then free variables). Null when
// unbound or unreadable.
Ref local_value(Namespaces& ns, PyCodeObject* co, int index) {
  PyObject* names = co->co_localsplusnames;
  if (names == nullptr || !PyTuple_Check(names) || index < 0 || index >= PyTuple_GET_SIZE(names))
    return Ref();
  PyObject* name = PyTuple_GET_ITEM(names, index);
  if (gFrameGetVar != nullptr) return Ref::steal(gFrameGetVar(ns.frame(), name));
  bool failed = false;
  return lookup_name(ns.locals(), name, &failed);
}

PyObject* name_at(PyCodeObject* co, int index) {
  PyObject* names = co->co_names;
  if (index < 0 || index >= PyTuple_GET_SIZE(names)) return nullptr;
  return PyTuple_GET_ITEM(names, index);
}

// The values a class expression leaves: one object, or the items of a final BUILD_TUPLE.
struct ValueStack {
  std::array<Ref, kMaxValues> values;
  int size = 0;
  bool push(Ref value) {
    if (!value || size == kMaxValues) return false;
    values[size++] = std::move(value);
    return true;
  }
};

// The shape of one clause, read before anything is evaluated.
struct ClauseShape {
  int expr = 0;        // first instruction of the class expression
  int check = 0;       // its CHECK_EXC_MATCH / CHECK_EG_MATCH
  int next = 0;        // target of the clause's conditional jump
  bool tuple = false;  // the expression ends with BUILD_TUPLE of all its values
};

// Reads the clause starting at `pos`: pure loads ending in the check, then the link to the
// next clause. False for anything else (a finally body, a call, a closure cell, ...).
bool scan_clause(const FrameCode& fc, int pos, bool star, ClauseShape* shape) {
  const auto& t = table();
  shape->expr = pos;
  shape->tuple = false;
  int depth = 0;
  Instr ins;
  for (int steps = 0;; ++steps) {
    if (steps == kMaxClauseSteps || !fc.decode(pos, &ins)) return false;
    int op = ins.op;
    if (is(op, star ? bytecode::kCheckEgMatch : bytecode::kCheckExcMatch)) break;
    if (shape->tuple && !is(op, bytecode::kNotTaken) && !is(op, bytecode::kNop)) return false;
    if (is(op, bytecode::kNop) || is(op, bytecode::kNotTaken)) {
      // no effect
    } else if (is(op, bytecode::kLoadGlobal)) {
      if (t.global_name_shift == 1 && (ins.arg & 1) != 0) return false;  // a call follows
      ++depth;
    } else if (is(op, bytecode::kLoadName) || is(op, bytecode::kLoadConst) ||
               is(op, bytecode::kLoadSmallInt) || is(op, bytecode::kLoadCommonConstant) ||
               is(op, bytecode::kLoadFast) || is(op, bytecode::kLoadFastCheck) ||
               is(op, bytecode::kLoadFastBorrow)) {
      ++depth;
    } else if (is(op, bytecode::kLoadFastLoadFast) ||
               is(op, bytecode::kLoadFastBorrowLoadFastBorrow)) {
      if (t.pair_shift == 0) return false;
      depth += 2;
    } else if (is(op, bytecode::kLoadAttr)) {
      if (t.attr_name_shift == 1 && (ins.arg & 1) != 0) return false;  // method form
      if (depth < 1) return false;
    } else if (is(op, bytecode::kBuildTuple)) {
      if (ins.arg != depth || depth < 1) return false;
      shape->tuple = true;
    } else {
      return false;
    }
    if (depth > kMaxValues) return false;
    pos = ins.next;
  }
  if (!shape->tuple && depth != 1) return false;
  shape->check = ins.offset;

  Instr link;
  if (!fc.decode(ins.next, &link)) return false;
  if (star) {
    // CHECK_EG_MATCH leaves (rest, match); COPY 1 and the jump-if-None test the match.
    if (!is(link.op, bytecode::kCopy) || link.arg != 1 || !fc.decode(link.next, &link))
      return false;
    if (!is(link.op, bytecode::kJumpIfNone)) return false;
  } else if (!is(link.op, bytecode::kJumpIfFalse)) {
    return false;
  }
  // Forward jumps count from the instruction after the jump and its caches.
  shape->next = link.next + 2 * link.arg;
  return shape->next > shape->check && shape->next < fc.size();
}

// Runs a scanned class expression in the frame's namespaces. False when a load failed (the
// interpreter would raise there instead of testing the clause): errors are cleared.
bool evaluate_clause(const FrameCode& fc, Namespaces& ns, const ClauseShape& shape,
                     ValueStack* stack) {
  const auto& t = table();
  PyCodeObject* co = fc.co();
  Instr ins;
  for (int pos = shape.expr; pos < shape.check; pos = ins.next) {
    if (!fc.decode(pos, &ins)) return false;
    int op = ins.op;
    Ref value;
    if (is(op, bytecode::kNop) || is(op, bytecode::kNotTaken) || is(op, bytecode::kBuildTuple)) {
      continue;  // the final tuple is kept as separate values
    } else if (is(op, bytecode::kLoadGlobal)) {
      PyObject* name = name_at(co, ins.arg >> t.global_name_shift);
      if (name == nullptr) return false;
      value = lookup_chain(name, ns.globals(), ns.builtins());
    } else if (is(op, bytecode::kLoadName)) {
      PyObject* name = name_at(co, ins.arg);
      if (name == nullptr) return false;
      value = lookup_chain(name, ns.locals(), ns.globals(), ns.builtins());
    } else if (is(op, bytecode::kLoadConst)) {
      if (ins.arg >= PyTuple_GET_SIZE(co->co_consts)) return false;
      value = Ref::borrow(PyTuple_GET_ITEM(co->co_consts, ins.arg));
    } else if (is(op, bytecode::kLoadSmallInt)) {
      value = Ref::steal(PyLong_FromLong(ins.arg));  // a cached small int, no allocation
    } else if (is(op, bytecode::kLoadCommonConstant)) {
      PyObject* common = t.common_constants.get();
      if (common == nullptr || ins.arg >= PyTuple_GET_SIZE(common)) return false;
      value = Ref::borrow(PyTuple_GET_ITEM(common, ins.arg));
    } else if (is(op, bytecode::kLoadFast) || is(op, bytecode::kLoadFastCheck) ||
               is(op, bytecode::kLoadFastBorrow)) {
      value = local_value(ns, co, ins.arg);
    } else if (is(op, bytecode::kLoadFastLoadFast) ||
               is(op, bytecode::kLoadFastBorrowLoadFastBorrow)) {
      if (!stack->push(local_value(ns, co, ins.arg >> t.pair_shift))) return false;
      value = local_value(ns, co, ins.arg & t.pair_mask);
    } else if (is(op, bytecode::kLoadAttr)) {
      PyObject* name = name_at(co, ins.arg >> t.attr_name_shift);
      if (name == nullptr || stack->size == 0) return false;
      Ref base = std::move(stack->values[--stack->size]);
      value = Ref::steal(PyObject_GetAttr(base.get(), name));
    } else {
      return false;  // scan_clause let nothing else through
    }
    if (!stack->push(std::move(value))) return false;
  }
  return true;
}

// ---- Matching ---------------------------------------------------------------------------

// The items a clause tests: the stack's values, or the items of a single tuple value.
struct ClauseItems {
  std::array<PyObject*, kMaxValues> own{};  // borrowed from a ValueStack
  PyObject* const* items = nullptr;
  Py_ssize_t count = 0;
};

void clause_items(const ValueStack& stack, bool built_tuple, ClauseItems* out) {
  PyObject* single = stack.values[0].get();
  if (!built_tuple && stack.size == 1 && PyTuple_Check(single)) {
    out->items = reinterpret_cast<PyTupleObject*>(single)->ob_item;
    out->count = PyTuple_GET_SIZE(single);
    return;
  }
  for (int i = 0; i < stack.size; ++i) out->own[i] = stack.values[i].get();
  out->items = out->own.data();
  out->count = stack.size;
}

// What the interpreter accepts as the value of an except clause: exception classes (and for
// except*, not exception-group classes). A tuple nested in a tuple is rejected too.
bool valid_clause_item(PyObject* item, bool star) {
  if (!PyExceptionClass_Check(item)) return false;
  if (star && PyType_IsSubtype(reinterpret_cast<PyTypeObject*>(item),
                               reinterpret_cast<PyTypeObject*>(PyExc_BaseExceptionGroup)))
    return false;
  return true;
}

bool item_matches(PyObject* item, PyObject* exc, PyObject* exc_type, int kind) {
  if (kind == kMatchExact) return item == exc || item == exc_type;
  // The interpreter's own test: a real subclass check that ignores __subclasscheck__.
  return PyErr_GivenExceptionMatches(exc, item) != 0;
}

bool any_item_matches(const ClauseItems& clause, PyObject* exc, PyObject* exc_type, int kind) {
  for (Py_ssize_t i = 0; i < clause.count; ++i) {
    if (item_matches(clause.items[i], exc, exc_type, kind)) return true;
  }
  return false;
}

// ---- Handler chains -----------------------------------------------------------------------

enum class Verdict {
  kNotCaught,
  kCaught,
  kMayBeSuppressed,  // a `with` whose exit may suppress it, and we cannot tell
};

// What one frame does with the exception, and where in its code.
struct FrameVerdict {
  Verdict verdict = Verdict::kNotCaught;
  int offset = -1;  // the catching clause, the `with` exit handler; -1: none
  Ref frame;        // the frame that decides: the analysed one, or a context manager's
};

// A chain of `except` clauses starting at `pos` (just after PUSH_EXC_INFO).
Verdict except_chain(const FrameCode& fc, Namespaces& ns, int pos, const Query& q,
                     int* clause_offset) {
  for (int index = 0; index < kMaxClauses; ++index) {
    Instr ins;
    if (!fc.decode(pos, &ins)) return Verdict::kNotCaught;
    if (is(ins.op, bytecode::kPopTop)) {
      do_dprintf(kDbgExceptions, "  bare except at %d\n", ins.offset);
      *clause_offset = ins.offset;
      return q.kind == kMatchGiven ? Verdict::kCaught : Verdict::kNotCaught;
    }
    if (is(ins.op, bytecode::kReraise)) return Verdict::kNotCaught;  // no clause matched
    ClauseShape shape;
    if (!scan_clause(fc, pos, false, &shape)) {
      do_dprintf(kDbgExceptions, "  finally body or unknown shape at %d\n", pos);
      return Verdict::kNotCaught;
    }
    ValueStack stack;
    if (!evaluate_clause(fc, ns, shape, &stack)) {
      // The interpreter would raise from the clause and try no later clause.
      PyErr_Clear();
      do_dprintf(kDbgExceptions, "  class expression at %d raised\n", shape.expr);
      return Verdict::kNotCaught;
    }
    ClauseItems clause;
    clause_items(stack, shape.tuple, &clause);
    for (Py_ssize_t i = 0; i < clause.count; ++i) {
      if (!valid_clause_item(clause.items[i], false)) return Verdict::kNotCaught;
    }
    if (any_item_matches(clause, q.exc, q.type, q.kind)) {
      do_dprintf(kDbgExceptions, "  clause at %d matches\n", shape.expr);
      *clause_offset = shape.check;
      return Verdict::kCaught;
    }
    pos = shape.next;
  }
  return Verdict::kNotCaught;
}

// Whether `node` is entirely taken by the except* clauses: matched itself, or a group whose
// every member is.
bool group_covered(PyObject* node, const ClauseItems& all, PyObject* type_of_root, const Query& q,
                   int depth) {
  PyObject* node_type = node == q.exc ? type_of_root : reinterpret_cast<PyObject*>(Py_TYPE(node));
  if (any_item_matches(all, node, node_type, q.kind)) return true;
  if (depth == kMaxGroupDepth ||
      !PyObject_TypeCheck(node, reinterpret_cast<PyTypeObject*>(PyExc_BaseExceptionGroup)))
    return false;
  PyObject* members = reinterpret_cast<PyBaseExceptionGroupObject*>(node)->excs;
  if (members == nullptr || !PyTuple_Check(members) || PyTuple_GET_SIZE(members) == 0) return false;
  for (Py_ssize_t i = 0; i < PyTuple_GET_SIZE(members); ++i) {
    if (!group_covered(PyTuple_GET_ITEM(members, i), all, type_of_root, q, depth + 1)) return false;
  }
  return true;
}

// A chain of `except*` clauses starting at `pos` (the first class expression). Every clause
// is evaluated, as the interpreter does; the exception is caught when the clauses together
// take all of it (a plain exception is wrapped and caught by any matching clause).
Verdict except_star_chain(const FrameCode& fc, Namespaces& ns, int pos, const Query& q) {
  std::array<Ref, kMaxValues> held;  // every clause value, kept alive until the end
  int held_count = 0;
  ClauseItems all;
  all.items = all.own.data();
  for (int index = 0; index < kMaxClauses; ++index) {
    ClauseShape shape;
    if (!scan_clause(fc, pos, true, &shape)) {
      do_dprintf(kDbgExceptions, "  unknown except* shape at %d\n", pos);
      return Verdict::kNotCaught;
    }
    ValueStack stack;
    if (!evaluate_clause(fc, ns, shape, &stack)) {
      PyErr_Clear();
      return Verdict::kNotCaught;
    }
    ClauseItems clause;
    clause_items(stack, shape.tuple, &clause);
    for (Py_ssize_t i = 0; i < clause.count; ++i) {
      if (!valid_clause_item(clause.items[i], true)) return Verdict::kNotCaught;
      if (all.count == kMaxValues) return Verdict::kNotCaught;
      all.own[all.count++] = clause.items[i];
    }
    for (int i = 0; i < stack.size; ++i) {
      if (held_count == kMaxValues) return Verdict::kNotCaught;
      held[held_count++] = std::move(stack.values[i]);
    }
    // The jump lands on POP_TOP (drops the empty match), then the next clause or the end.
    Instr ins;
    if (!fc.decode(shape.next, &ins) || !is(ins.op, bytecode::kPopTop)) return Verdict::kNotCaught;
    pos = ins.next;
    if (!fc.decode(pos, &ins)) return Verdict::kNotCaught;
    if (is(ins.op, bytecode::kListAppend)) break;
  }
  bool covered = group_covered(q.exc, all, q.type, q, 0);
  do_dprintf(kDbgExceptions, "  except* clauses %s\n", covered ? "take all" : "leave a rest");
  return covered ? Verdict::kCaught : Verdict::kNotCaught;
}

// The prologue of an except* chain after PUSH_EXC_INFO: COPY 1; BUILD_LIST 0; SWAP 2 (3.11)
// or BUILD_LIST 0; COPY 2 (3.12+). Returns the offset of the first class expression, or -1.
int except_star_start(const FrameCode& fc, int pos) {
  bool saw_list = false;
  for (int i = 0; i < 3; ++i) {
    Instr ins;
    if (!fc.decode(pos, &ins)) return -1;
    if (is(ins.op, bytecode::kBuildList) && ins.arg == 0) {
      saw_list = true;
    } else if (!is(ins.op, bytecode::kCopy) && !is(ins.op, bytecode::kSwap)) {
      break;
    }
    pos = ins.next;
  }
  return saw_list ? pos : -1;
}

bool exc_matches(PyObject* exc, PyObject* cls) {
  return PyErr_GivenExceptionMatches(exc, cls) != 0;
}

PyFrameObject* as_frame(PyObject* obj) {
  return reinterpret_cast<PyFrameObject*>(obj);
}

FrameVerdict frame_verdict(PyFrameObject* frame, const Query& q, int nesting);

// ---- `with` blocks ------------------------------------------------------------------------
//
// A `with` exit may suppress the exception by returning true. Two context managers of the
// standard library are read exactly, from the objects' own attributes (their classes define
// no descriptors for them, so no code of the program runs): contextlib.suppress, and the
// manager of a @contextmanager generator, whose suspended frame is analysed at its yield, as
// the exception will be thrown in there. Every other exit may suppress it: we cannot know
// without calling it.

constexpr int kMaxManagerNesting = 8;  // generators managing generators

// An attribute of an already imported module, read from the module's dictionary: nothing is
// imported and no code runs. Borrowed; null when the module or the name is not there.
PyObject* loaded_module_attr(const char* module, const char* name) {
  PyObject* modules = PyImport_GetModuleDict();
  if (modules == nullptr || !PyDict_Check(modules)) return nullptr;
  PyObject* mod = PyDict_GetItemString(modules, module);
  if (mod == nullptr || !PyModule_Check(mod)) return nullptr;
  PyObject* dict = PyModule_GetDict(mod);
  return dict != nullptr ? PyDict_GetItemString(dict, name) : nullptr;
}

bool has_exact_type(PyObject* obj, PyObject* type) {
  return type != nullptr && reinterpret_cast<PyObject*>(Py_TYPE(obj)) == type;
}

// An instance attribute of a standard-library object of exactly its class.
Ref instance_attr(PyObject* obj, const char* name) {
  Ref key = Ref::steal(PyUnicode_FromString(name));
  if (!key) return Ref();
  return Ref::steal(PyObject_GenericGetAttr(obj, key.get()));
}

bool is_group(PyObject* exc) {
  return PyObject_TypeCheck(exc, reinterpret_cast<PyTypeObject*>(PyExc_BaseExceptionGroup));
}

// contextlib.suppress(*types): suppresses what matches one of its types. A group that does
// not match as a whole may be split by it: uncertain.
Verdict suppress_verdict(PyObject* manager, const Query& q) {
  Ref types = instance_attr(manager, "_exceptions");
  if (!types || !PyTuple_Check(types.get())) return Verdict::kMayBeSuppressed;
  ClauseItems items;
  items.items = reinterpret_cast<PyTupleObject*>(types.get())->ob_item;
  items.count = PyTuple_GET_SIZE(types.get());
  for (Py_ssize_t i = 0; i < items.count; ++i) {
    if (!PyExceptionClass_Check(items.items[i])) return Verdict::kMayBeSuppressed;
  }
  if (any_item_matches(items, q.exc, q.type, q.kind)) return Verdict::kCaught;
  return is_group(q.exc) ? Verdict::kMayBeSuppressed : Verdict::kNotCaught;
}

// The manager of a @contextmanager generator throws the exception into the generator at its
// yield and suppresses it when the generator catches it. A StopIteration gets special
// treatment there, and a generator that is not suspended cannot be read: uncertain.
Verdict generator_manager_verdict(PyObject* manager, const Query& q, int nesting,
                                  FrameVerdict* inner) {
  if (nesting >= kMaxManagerNesting || exc_matches(q.exc, PyExc_StopIteration))
    return Verdict::kMayBeSuppressed;
  Ref gen = instance_attr(manager, "gen");
  if (!gen || !PyGen_CheckExact(gen.get())) return Verdict::kMayBeSuppressed;
  Ref suspended = Ref::steal(PyObject_GetAttrString(gen.get(), "gi_suspended"));
  Ref frame = Ref::steal(PyObject_GetAttrString(gen.get(), "gi_frame"));
  if (!suspended || suspended.get() != Py_True || !frame || !compat::is_plain_frame(frame.get()))
    return Verdict::kMayBeSuppressed;
  FrameVerdict verdict = frame_verdict(as_frame(frame.get()), q, nesting + 1);
  // Not caught in the generator: the manager's exit lets the same exception go on.
  if (verdict.verdict == Verdict::kNotCaught) return Verdict::kNotCaught;
  *inner = std::move(verdict);
  return inner->verdict;
}

// The `with` block whose exit handler `entry` leads to, in `frame`.
Verdict with_exit_verdict(PyFrameObject* frame, const TableEntry& entry, const Query& q,
                          int nesting, FrameVerdict* inner) {
  PyObject* manager = compat::with_manager_of(frame, entry.depth);
  if (manager == nullptr) return Verdict::kMayBeSuppressed;
  if (has_exact_type(manager, loaded_module_attr("contextlib", "suppress")))
    return suppress_verdict(manager, q);
  if (has_exact_type(manager, loaded_module_attr("contextlib", "_GeneratorContextManager")))
    return generator_manager_verdict(manager, q, nesting, inner);
  return Verdict::kMayBeSuppressed;
}

// ---- One frame ------------------------------------------------------------------------------

// Decides what the handler of `entry` does with the exception; `out` receives where.
Verdict handler_at(PyFrameObject* frame, const FrameCode& fc, Namespaces& ns,
                   const TableEntry& entry, const Query& q, int nesting, FrameVerdict* out) {
  int target = entry.target;
  out->offset = target;
  Instr ins;
  if (!fc.decode(target, &ins)) return Verdict::kNotCaught;
  if (is(ins.op, bytecode::kEndAsyncFor)) {
    bool ends_loop = PyErr_GivenExceptionMatches(q.exc, PyExc_StopAsyncIteration) != 0;
    do_dprintf(kDbgExceptions, "  async for end at %d\n", target);
    return ends_loop ? Verdict::kCaught : Verdict::kNotCaught;
  }
  if (!is(ins.op, bytecode::kPushExcInfo)) {
    do_dprintf(kDbgExceptions, "  compiler cleanup at %d\n", target);
    return Verdict::kNotCaught;
  }
  Instr first;
  if (!fc.decode(ins.next, &first)) return Verdict::kNotCaught;
  if (is(first.op, bytecode::kWithExceptStart)) {
    do_dprintf(kDbgExceptions, "  with exit at %d\n", target);
    return with_exit_verdict(frame, entry, q, nesting, out);
  }
  if (is(first.op, bytecode::kBuildList) || is(first.op, bytecode::kCopy)) {
    int star = except_star_start(fc, ins.next);
    if (star >= 0) return except_star_chain(fc, ns, star, q);
  }
  return except_chain(fc, ns, ins.next, q, &out->offset);
}

// What the handlers active in `frame` do with the exception: the first that catches it, or
// else the first `with` that may suppress it.
FrameVerdict frame_verdict(PyFrameObject* frame, const Query& q, int nesting) {
  FrameVerdict result;
  FrameCode fc;
  if (!fc.open(frame)) return result;
  int offset = PyFrame_GetLasti(frame);
  Namespaces ns(frame);
  TableEntry entry;
  for (int hop = 0; hop < kMaxHandlerHops; ++hop) {
    if (!bytecode::find_handler(fc.exception_table(), offset, &entry)) break;
    do_dprintf(kDbgExceptions, "  offset %d handled at %d\n", offset, entry.target);
    FrameVerdict here;
    Verdict verdict = handler_at(frame, fc, ns, entry, q, nesting, &here);
    if (verdict != Verdict::kNotCaught) {
      if (!here.frame) here.frame = Ref::borrow(reinterpret_cast<PyObject*>(frame));
      here.verdict = verdict;
      if (verdict == Verdict::kCaught) return here;
      if (result.verdict == Verdict::kNotCaught) result = std::move(here);
    }
    // The entry covering the handler itself leads to the next handler outward.
    offset = entry.target;
  }
  return result;
}

// Exceptions that end where a generator or coroutine body is left, whatever the callers do:
// StopIteration (and, for async generators, StopAsyncIteration) is replaced by RuntimeError,
// which is reported on its own; GeneratorExit is what close() throws in and then swallows.
bool ends_at_body_exit(PyFrameObject* frame, PyObject* exc) {
  Ref code = Ref::steal(reinterpret_cast<PyObject*>(PyFrame_GetCode(frame)));
  if (!code) return false;
  int flags = reinterpret_cast<PyCodeObject*>(code.get())->co_flags;
  bool async_gen = (flags & CO_ASYNC_GENERATOR) != 0;
  if ((flags & (CO_GENERATOR | CO_COROUTINE | CO_ITERABLE_COROUTINE)) == 0 && !async_gen)
    return false;
  if (exc_matches(exc, PyExc_StopIteration) || exc_matches(exc, PyExc_GeneratorExit)) return true;
  return async_gen && exc_matches(exc, PyExc_StopAsyncIteration);
}

bool is_generator_code(PyFrameObject* frame) {
  Ref code = Ref::steal(reinterpret_cast<PyObject*>(PyFrame_GetCode(frame)));
  int flags = code ? reinterpret_cast<PyCodeObject*>(code.get())->co_flags : 0;
  return (flags & (CO_GENERATOR | CO_COROUTINE | CO_ITERABLE_COROUTINE | CO_ASYNC_GENERATOR)) != 0;
}

// The opcode the frame stands on (its current instruction, or the call it waits in).
int current_opcode(PyFrameObject* frame) {
  FrameCode fc;
  return fc.open(frame) ? fc.opcode_around(PyFrame_GetLasti(frame)) : -1;
}

// A `for` loop or a `yield from`/`await` ends with the StopIteration its iterator raises, at
// the instruction that asks for the next item. An IndexError never ends them there: the C
// iterator of the old sequence protocol ends its own IndexError before the loop sees it.
bool stop_iter_handled(PyFrameObject* frame, PyObject* exc) {
  if (!exc_matches(exc, PyExc_StopIteration)) return false;
  int op = current_opcode(frame);
  return is(op, bytecode::kForIter) || is(op, bytecode::kSend);
}

// A generator or coroutine resumed by its caller's `for` or `yield from`/`await`: the C code
// between them (the generator's next/send) passes every exception on, so this entry from C
// is no place where the exception may end.
bool resumed_by_caller_loop(PyFrameObject* frame, PyFrameObject* caller) {
  if (!is_generator_code(frame)) return false;
  int op = current_opcode(caller);
  return is(op, bytecode::kForIter) || is(op, bytecode::kSend);
}

// Code that runs in a namespace (a module, a class body, text given to exec or eval) is
// started by exec, eval, the class statement or the import system's exec, which end no
// exception: entering it from C is no place where the exception may end.
bool runs_in_namespace(PyFrameObject* frame) {
  Ref code = Ref::steal(reinterpret_cast<PyObject*>(PyFrame_GetCode(frame)));
  int flags = code ? reinterpret_cast<PyCodeObject*>(code.get())->co_flags : CO_OPTIMIZED;
  return (flags & CO_OPTIMIZED) == 0;
}

// A call with unpacked arguments where the interpreter reaches even a Python function
// through its C call machinery. (A builtin called that way that calls back into Python, say
// getattr(*args), is then not seen: a stop it could have spared may happen; none is lost.)
bool star_call_through_c(PyFrameObject* caller) {
  return compat::kStarCallGoesThroughC && is(current_opcode(caller), bytecode::kCallFunctionEx);
}

// True when C code lies between `frame` and `caller` that may end the exception.
bool c_code_between(PyFrameObject* frame, PyFrameObject* caller) {
  return compat::frame_entered_from_c(frame) && !runs_in_namespace(frame) &&
         !resumed_by_caller_loop(frame, caller) && !star_call_through_c(caller);
}

CatchPrediction prediction(CatchKind kind, Ref frame, int offset) {
  CatchPrediction p;
  p.kind = kind;
  p.frame = std::move(frame);
  p.offset = offset;
  return p;
}

CatchPrediction from_verdict(FrameVerdict& v) {
  return prediction(v.verdict == Verdict::kCaught ? CatchKind::kCaught : CatchKind::kWith,
                    std::move(v.frame), v.offset);
}

// The walk from the frame where the exception is now outward. The first place that surely
// catches it answers; else the innermost place that may (a `with` exit, C code).
//
// The debugger marks its own frames (those that run the program) as frames whose handlers
// are ignored; from the first of them outward only a sure catch counts: the debugger's own
// `with` blocks and calls into C never end the program's exceptions.
CatchPrediction walk_frames(const CatchQuestion& question, const Query& q) {
  CatchPrediction maybe;
  bool maybe_counts = true;
  Ref current = Ref::borrow(question.frame);
  for (bool first = true; current; first = false) {
    if (!compat::is_plain_frame(current.get())) {
      if (question.this_frame_only) break;
      current = frame_back(current.get());
      continue;
    }
    PyFrameObject* f = as_frame(current.get());
    bool leaving = first && question.leaving_frame;
    bool ignored = frame_handlers_ignored(current.get(), question.ignored_handlers) != 0;
    if (ignored) maybe_counts = false;
    if (!leaving && !ignored) {
      if (first && stop_iter_handled(f, q.exc)) return prediction(CatchKind::kCaught, current, -1);
      FrameVerdict verdict = frame_verdict(f, q, 0);
      if (verdict.verdict == Verdict::kCaught) return from_verdict(verdict);
      if (verdict.verdict != Verdict::kNotCaught && maybe_counts &&
          maybe.kind == CatchKind::kUncaught)
        maybe = from_verdict(verdict);
    }
    if (ends_at_body_exit(f, q.exc)) return prediction(CatchKind::kCaught, current, -1);
    if (question.this_frame_only || current.get() == question.outermost) break;
    Ref back = compat::frame_back(f);
    // C code called by a frame whose handlers are ignored belongs to what runs the program
    // (on 3.14 a thread's bootstrap calls run() through Context.run): it ends nothing.
    if (back && compat::is_plain_frame(back.get()) && maybe_counts &&
        maybe.kind == CatchKind::kUncaught && c_code_between(f, as_frame(back.get())) &&
        frame_handlers_ignored(back.get(), question.ignored_handlers) == 0)
      maybe = prediction(CatchKind::kCCode, back, -1);
    current = std::move(back);
  }
  return maybe;
}

// A handler the compiler wraps around code by itself, with no construct of the user's behind
// it: the generator and coroutine body wrapper (CALL_INTRINSIC_1 STOPITERATION_ERROR), the
// restore of an inlined comprehension (SWAP 2; POP_TOP; SWAP n ...) and the throw() cleanup
// of `yield from`/`await` (CLEANUP_THROW).
bool compiler_wrapper_at(const FrameCode& fc, int target) {
  Instr ins;
  if (!fc.decode(target, &ins)) return false;
  if (is(ins.op, bytecode::kCleanupThrow)) return true;
  if (is(ins.op, bytecode::kCallIntrinsic1))
    return ins.arg == table().intrinsic_stopiteration_error;
  if (is(ins.op, bytecode::kSwap) && ins.arg == 2) {
    Instr next;
    return fc.decode(ins.next, &next) && is(next.op, bytecode::kPopTop) &&
           fc.decode(next.next, &next) && is(next.op, bytecode::kSwap);
  }
  return false;
}

}  // namespace

int init_handler_analysis() {
  gFrameGetVar = reinterpret_cast<decltype(gFrameGetVar)>(lookup_python_function("PyFrame_GetVar"));
  return bytecode::init_opcodes();
}

int frame_handlers_ignored(PyObject* frame, PyObject* ignored_handlers) {
  if (frame == nullptr || !compat::is_plain_frame(frame) || ignored_handlers == nullptr ||
      !PyDict_Check(ignored_handlers))
    return 0;
  KeepThreadState keep;
  Ref code = Ref::steal(reinterpret_cast<PyObject*>(PyFrame_GetCode(as_frame(frame))));
  int found = code ? PyDict_Contains(ignored_handlers, code.get()) : 0;
  if (found == 0) found = PyDict_Contains(ignored_handlers, frame);
  if (found < 0) PyErr_Clear();
  return found == 1 ? 1 : 0;
}

CatchPrediction predict_catch(const CatchQuestion& question) {
  if (!table().ready || question.frame == nullptr || question.exc == nullptr)
    return CatchPrediction();
  KeepThreadState keep;
  PyObject* exc = question.exc;
  Query q{exc, PyExceptionInstance_Check(exc) ? reinterpret_cast<PyObject*>(Py_TYPE(exc)) : exc,
          question.match_kind};
  CatchPrediction answer = walk_frames(question, q);
  do_dprintf(kDbgExceptions, "predict_catch: %d\n", static_cast<int>(answer.kind));
  return answer;
}

int catch_prediction_line(const CatchPrediction& prediction) {
  if (!prediction.frame || !compat::is_plain_frame(prediction.frame.get())) return 0;
  PyFrameObject* frame = as_frame(prediction.frame.get());
  if (prediction.offset < 0) return PyFrame_GetLineNumber(frame);
  Ref code = Ref::steal(reinterpret_cast<PyObject*>(PyFrame_GetCode(frame)));
  int line =
      code ? PyCode_Addr2Line(reinterpret_cast<PyCodeObject*>(code.get()), prediction.offset) : -1;
  return line > 0 ? line : PyFrame_GetLineNumber(frame);
}

int __tracer_exc_handled(PyObject* frame, PyObject* ignored_handlers, PyObject* exc, int match_kind,
                         int this_frame_only) {
  CatchQuestion question;
  question.frame = frame;
  question.exc = exc;
  question.ignored_handlers = ignored_handlers;
  question.match_kind = match_kind;
  question.this_frame_only = this_frame_only != 0;
  int handled = predict_catch(question).kind == CatchKind::kCaught ? 1 : 0;
  do_dprintf(kDbgExceptions, "__tracer_exc_handled: %d\n", handled);
  return handled;
}

int exc_stop_iter_handled(PyObject* frame, PyObject* exc) {
  if (!table().ready || frame == nullptr || exc == nullptr || !compat::is_plain_frame(frame))
    return 0;
  KeepThreadState keep;
  return stop_iter_handled(as_frame(frame), exc) ? 1 : 0;
}

int frame_has_active_handler(PyObject* frame) {
  if (!table().ready || frame == nullptr || !compat::is_plain_frame(frame)) return 0;
  KeepThreadState keep;
  FrameCode fc;
  if (!fc.open(as_frame(frame))) return 0;
  int offset = PyFrame_GetLasti(as_frame(frame));
  TableEntry entry;
  for (int hop = 0; hop < kMaxHandlerHops; ++hop) {
    if (!bytecode::find_handler(fc.exception_table(), offset, &entry)) return 0;
    if (!compiler_wrapper_at(fc, entry.target)) return 1;
    offset = entry.target;
  }
  return 0;
}

int frame_entering_handler(PyObject* frame) {
  if (!table().ready || frame == nullptr || !compat::is_plain_frame(frame)) return 0;
  KeepThreadState keep;
  FrameCode fc;
  if (!fc.open(as_frame(frame))) return 0;
  return is(fc.opcode_around(PyFrame_GetLasti(as_frame(frame))), bytecode::kPushExcInfo) ? 1 : 0;
}

PyObject* __find_inner_frame(PyObject* traceback) {
  if (traceback == nullptr || traceback == Py_None) return Py_NewRef(Py_None);
  KeepThreadState keep;
  Ref entry = Ref::borrow(traceback);
  for (;;) {
    Ref next;
    if (PyTraceBack_Check(entry.get())) {
      next = Ref::borrow(
          reinterpret_cast<PyObject*>(reinterpret_cast<PyTracebackObject*>(entry.get())->tb_next));
    } else {
      next = Ref::steal(PyObject_GetAttrString(entry.get(), "tb_next"));
      if (!next) PyErr_Clear();
    }
    if (!next || next.is_none()) break;
    entry = std::move(next);
  }
  if (PyTraceBack_Check(entry.get())) {
    return Py_XNewRef(
        reinterpret_cast<PyObject*>(reinterpret_cast<PyTracebackObject*>(entry.get())->tb_frame));
  }
  Ref frame = Ref::steal(PyObject_GetAttrString(entry.get(), "tb_frame"));
  return frame.release();
}

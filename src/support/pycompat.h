// pycompat.h: everything that differs between the interpreters we support (3.11 to 3.15).
//
// The rest of the core calls these inline accessors and never tests PY_VERSION_HEX itself.
// Each accessor says whether it returns a borrowed or a new reference. Private thread-state
// fields are read here and nowhere else; tests/native/core/test_private_fields.cpp fails on
// an interpreter where one of them (or the f_trace descriptor, or a code-object field the
// core reads) moved or stopped meaning what we rely on.
//
// 3.14 and 3.15 need no branch of their own: the trace-function protocol, the thread-state
// fields used here and the frame API behave as on 3.13. What they deprecate is avoided on
// every version: the current thread state comes from PyThreadState_GetUnchecked from 3.13 on
// (the old private name warns from 3.14), and nothing here deletes through a frame's locals
// proxy, whose error changed from TypeError to ValueError in 3.13.x.
#pragma once

#include <Python.h>
#include <frameobject.h>

#if PY_VERSION_HEX < 0x030B0000
#error "the debugger core needs CPython 3.11 or later"
#endif
#if PY_VERSION_HEX >= 0x030C0000 && PY_VERSION_HEX < 0x030D0000
#include <opcode.h>
#endif

#include <cstdint>
#include <new>
#include <unordered_set>

#include "support/ref.h"

namespace compat {

// ---- Thread states ---------------------------------------------------------------------

// The calling thread's state, or null when it has none (never a fatal error). Borrowed.
inline PyThreadState* current_tstate() noexcept {
#if PY_VERSION_HEX >= 0x030D0000
  return PyThreadState_GetUnchecked();
#else
  return _PyThreadState_UncheckedGet();
#endif
}

// The thread's identity as threading.get_ident() reports it (private field).
inline unsigned long tstate_thread_id(PyThreadState* ts) noexcept {
  return ts->thread_id;
}

// The trace object installed with PyEval_SetTrace in `ts` (private field). Borrowed.
inline PyObject* tstate_traceobj(PyThreadState* ts) noexcept {
  return ts->c_traceobj;
}
inline Py_tracefunc tstate_tracefunc(PyThreadState* ts) noexcept {
  return ts->c_tracefunc;
}
inline bool tstate_has_trace_or_profile(PyThreadState* ts) noexcept {
  return ts->c_tracefunc != nullptr || ts->c_profilefunc != nullptr;
}

// Sets the C trace function of another thread. 3.11 and 3.12 export a call for it; 3.13
// does not, and answers false so that the caller falls back (the thread then installs
// itself at its next event, or the caller uses set_trace_all_threads).
inline bool set_trace_for_thread(PyThreadState* ts, Py_tracefunc func, PyObject* obj) noexcept {
  if (ts == current_tstate()) {
    PyEval_SetTrace(func, obj);
    return true;
  }
#if PY_VERSION_HEX >= 0x030D0000
  (void)func;
  (void)obj;
  return false;
#else
  return _PyEval_SetTrace(ts, func, obj) == 0;
#endif
}

// Sets the C trace function of every existing thread at once, where the interpreter has the
// call (3.12+). Answers false on 3.11, where callers set it thread by thread.
inline bool set_trace_all_threads(Py_tracefunc func, PyObject* obj) noexcept {
#if PY_VERSION_HEX >= 0x030C0000
  PyEval_SetTraceAllThreads(func, obj);
  return true;
#else
  (void)func;
  (void)obj;
  return false;
#endif
}

// ---- The "tracing" counter and the "use tracing" switch --------------------------------
//
// Every supported interpreter skips trace and profile calls while `tracing` is above 0
// (3.12+ also silences sys.monitoring tools then). 3.11 keeps a separate per-thread flag,
// `cframe->use_tracing`, that the interpreter recomputes whenever a callback returns or a
// hook is set, and 3.12+ has no such flag at all. So the switch is built on the counter on
// every version: switching it off adds one hidden unit to that thread state's `tracing`,
// switching it on removes it. The counter that callers read and adjust is the interpreter's
// minus that hidden unit, so the two contracts stay independent. The thread states holding
// a hidden unit are remembered by their id, which the interpreter never reuses (addresses
// it does); an OS thread may also run several thread states one after another.

namespace detail {
inline std::unordered_set<uint64_t>& use_tracing_off_ids() {
  static auto* ids = new std::unordered_set<uint64_t>();  // lives as long as the process
  return *ids;
}
inline bool use_tracing_is_off(PyThreadState* ts) {
  auto& ids = use_tracing_off_ids();
  return !ids.empty() && ids.count(PyThreadState_GetID(ts)) != 0;
}
}  // namespace detail

// The thread's tracing depth as callers see it (the interpreter's counter without the unit
// that a switched-off use_tracing holds).
inline int tracing_get(PyThreadState* ts) noexcept {
  return ts->tracing - (detail::use_tracing_is_off(ts) ? 1 : 0);
}
// Adds to the counter. 3.11 also keeps `cframe->use_tracing` equal to "tracing is 0 and a
// trace or profile function is set" and asserts it in debug builds; it is recomputed here by
// the interpreter's own rule. Later versions have no such flag.
inline void tracing_add(PyThreadState* ts, int delta) noexcept {
  ts->tracing += delta;
#if PY_VERSION_HEX < 0x030C0000
  bool use = ts->tracing == 0 && tstate_has_trace_or_profile(ts);
  ts->cframe->use_tracing = use ? 255 : 0;
#endif
}

// Raises the counter back to `floor` when code run meanwhile left it lower; true when it did.
inline bool tracing_repair(PyThreadState* ts, int floor) noexcept {
  int now = tracing_get(ts);
  if (now >= floor) return false;
  tracing_add(ts, floor - now);
  return true;
}

// 1 when trace and profile functions would be called in this thread now, else 0.
inline int use_tracing_get(PyThreadState* ts) noexcept {
  if (detail::use_tracing_is_off(ts)) return 0;
  return (ts->tracing == 0 && tstate_has_trace_or_profile(ts)) ? 1 : 0;
}

// 0 stops trace and profile calls in the calling thread until a non-zero value is set.
// Returns false only when remembering the thread failed (out of memory).
inline bool use_tracing_set(PyThreadState* ts, int value) noexcept {
  bool off = value == 0;
  if (off == detail::use_tracing_is_off(ts)) return true;
  uint64_t id = PyThreadState_GetID(ts);
  if (off) {
    try {
      detail::use_tracing_off_ids().insert(id);
    } catch (const std::bad_alloc&) {
      return false;
    }
    PyThreadState_EnterTracing(ts);
  } else {
    detail::use_tracing_off_ids().erase(id);
    PyThreadState_LeaveTracing(ts);
  }
  return true;
}

// ---- Builtin functions ---------------------------------------------------------------------

// The method definition behind a builtin function or method object, or null for any other
// object. Borrowed: it lives as long as the method table it comes from.
inline PyMethodDef* method_def_of(PyObject* function) noexcept {
  if (!PyCFunction_Check(function)) return nullptr;
  return reinterpret_cast<PyCFunctionObject*>(function)->m_ml;
}

// ---- Recursion room ----------------------------------------------------------------------

// How many more nested calls the thread may make before the interpreter raises RecursionError
// (private fields). 3.12 and 3.13 count Python frames and C calls apart: the smaller budget.
// From 3.14 on C calls are bounded by the machine stack, which keeps a margin of its own
// beyond the point where RecursionError is raised: only Python frames are counted.
inline int recursion_room_left(PyThreadState* ts) noexcept {
#if PY_VERSION_HEX < 0x030C0000
  return ts->recursion_remaining;
#elif PY_VERSION_HEX < 0x030E0000
  return ts->py_recursion_remaining < ts->c_recursion_remaining ? ts->py_recursion_remaining
                                                                : ts->c_recursion_remaining;
#else
  return ts->py_recursion_remaining;
#endif
}

// Lets the thread nest `extra` more calls (a negative number takes them back). Only the
// thread's own budget moves: the limit the program set, and other threads, never see it.
inline void recursion_room_add(PyThreadState* ts, int extra) noexcept {
#if PY_VERSION_HEX < 0x030C0000
  ts->recursion_remaining += extra;
#elif PY_VERSION_HEX < 0x030E0000
  ts->py_recursion_remaining += extra;
  ts->c_recursion_remaining += extra;
#else
  ts->py_recursion_remaining += extra;
#endif
}

// While it lives, the calling thread has at least `room` nested calls left: the core's own
// calls made close to the program's recursion limit (the server side's callbacks, the
// attributes an exception analysis reads) must not raise a RecursionError the program would
// not have seen. Whatever was added is taken back at the end, so the program's own budget is
// what it was.
class RecursionRoom {
 public:
  explicit RecursionRoom(int room) noexcept : ts_(PyThreadState_Get()) {
    int left = recursion_room_left(ts_);
    if (left < room) {
      added_ = room - left;
      recursion_room_add(ts_, added_);
    }
  }
  ~RecursionRoom() {
    if (added_ != 0) recursion_room_add(ts_, -added_);
  }
  RecursionRoom(const RecursionRoom&) = delete;
  RecursionRoom& operator=(const RecursionRoom&) = delete;

 private:
  PyThreadState* ts_;
  int added_ = 0;
};

// ---- The pending exception -------------------------------------------------------------

// Holds the calling thread's pending exception while the core runs Python code of its own.
// fetch() takes it out of the thread (clearing it); restore() puts it back, replacing
// anything raised meanwhile.
class PendingError {
 public:
  void fetch() noexcept {
#if PY_VERSION_HEX >= 0x030C0000
    exc_ = PyErr_GetRaisedException();
#else
    PyErr_Fetch(&type_, &exc_, &tb_);
#endif
  }
  void restore() noexcept {
#if PY_VERSION_HEX >= 0x030C0000
    PyErr_SetRaisedException(exc_);
#else
    PyErr_Restore(type_, exc_, tb_);
    type_ = tb_ = nullptr;
#endif
    exc_ = nullptr;
  }
  bool empty() const noexcept { return exc_ == nullptr && type_ == nullptr; }

  // Writes the held exception and its traceback to sys.stderr and keeps holding it. Unlike
  // PyErr_Print this never exits the process on SystemExit and leaves sys.last_* alone:
  // logging a failure of the core must not change what the program sees.
  void display() noexcept {
#if PY_VERSION_HEX >= 0x030C0000
    if (exc_ != nullptr) PyErr_DisplayException(exc_);
#else
    if (type_ == nullptr) return;
    PyErr_NormalizeException(&type_, &exc_, &tb_);
    PyErr_Display(type_, exc_, tb_);
#endif
  }

 private:
  PyObject* type_ = nullptr;
  PyObject* exc_ = nullptr;
  PyObject* tb_ = nullptr;
};

// ---- Frames ------------------------------------------------------------------------------

inline bool is_plain_frame(PyObject* obj) noexcept {
  return Py_IS_TYPE(obj, &PyFrame_Type);
}

// Whether `obj` is the write-through view of a function frame's variables that
// PyFrame_GetLocals answers from 3.13 on (earlier versions answer a dictionary).
inline bool is_frame_locals_proxy(PyObject* obj) noexcept {
#if PY_VERSION_HEX >= 0x030D0000
  return PyFrameLocalsProxy_Check(obj);
#else
  (void)obj;
  return false;
#endif
}

// The attribute `name` of `type` or of a type in its method resolution order, or null when
// none has it. Borrowed; sets no error and runs no Python code. The interpreter's own
// look-up (exported but private on every supported version).
inline PyObject* type_lookup(PyTypeObject* type, PyObject* name) noexcept {
  return _PyType_Lookup(type, name);
}

// ---- A function frame's own variables ----------------------------------------------------
//
// On 3.11 and 3.12 the only public way to read one variable of a running function frame is
// PyFrame_GetLocals, which copies every variable into the frame's dictionary first. A hot
// breakpoint condition that reads one variable reads its slot here instead, through the
// layout of the interpreter's frame records (private: tests/native/core/test_pycompat.cpp
// fails where it moved). From 3.13 on PyFrame_GetLocals answers a view that reads the slots
// itself, and this answers "unknown".

enum class FastLocal { kValue, kUnbound, kUnknown };

#if PY_VERSION_HEX < 0x030D0000
namespace frame_layout {
struct FrameObject {
  PyObject_HEAD PyObject* f_back;
  void* f_frame;  // the interpreter's record of the running frame
};
#if PY_VERSION_HEX >= 0x030C0000
struct InterpreterFrame {
  PyCodeObject* f_code;
  void* previous;
  PyObject* f_funcobj;
  PyObject* f_globals;
  PyObject* f_builtins;
  PyObject* f_locals;
  PyFrameObject* frame_obj;
  void* prev_instr;
  int stacktop;
  uint16_t return_offset;
  char owner;
  PyObject* localsplus[1];
};
#else
struct InterpreterFrame {
  PyObject* f_func;
  PyObject* f_globals;
  PyObject* f_builtins;
  PyObject* f_locals;
  PyCodeObject* f_code;
  PyFrameObject* frame_obj;
  void* previous;
  void* prev_instr;
  int stacktop;
  bool is_entry;
  char owner;
  PyObject* localsplus[1];
};
#endif
// Kinds of a code object's variables (co_localspluskinds).
constexpr unsigned char kPlainLocal = 0x20;
constexpr unsigned char kNotPlain = 0x10 | 0x40 | 0x80;  // hidden, cell, free
}  // namespace frame_layout
#endif

// The plain local variable `name` (a str) of a running function frame, read from
// its slot: kValue with `*value` borrowed, or kUnbound. kUnknown when the frame is no
// function's, `name` is not one of its plain locals (a cell, a free or hidden variable, a
// name it does not have), or the interpreter offers no such read; the caller then asks
// PyFrame_GetLocals.
inline FastLocal frame_fast_local(PyFrameObject* frame, PyObject* name, PyObject** value) noexcept {
#if PY_VERSION_HEX >= 0x030D0000
  (void)frame, (void)name, (void)value;
  return FastLocal::kUnknown;
#else
  auto* record = static_cast<frame_layout::InterpreterFrame*>(
      reinterpret_cast<frame_layout::FrameObject*>(frame)->f_frame);
  if (record == nullptr || record->frame_obj != frame) return FastLocal::kUnknown;
  // The record must be the frame's own: it points back at the frame object, and its code is
  // the one the public call answers.
  PyCodeObject* code = record->f_code;
  PyCodeObject* expected = PyFrame_GetCode(frame);
  Py_DECREF(expected);
  if (code != expected || (code->co_flags & CO_OPTIMIZED) == 0) return FastLocal::kUnknown;
  PyObject* names = code->co_localsplusnames;
  const char* kinds = PyBytes_AS_STRING(code->co_localspluskinds);
  for (int i = 0; i < code->co_nlocalsplus; ++i) {
    PyObject* own = PyTuple_GET_ITEM(names, i);
    // Names are interned on both sides as a rule; equal text is the same name regardless.
    if (own != name && (PyUnicode_GET_LENGTH(own) != PyUnicode_GET_LENGTH(name) ||
                        PyUnicode_Compare(own, name) != 0)) {
      continue;
    }
    auto kind = static_cast<unsigned char>(kinds[i]);
    if ((kind & frame_layout::kNotPlain) != 0 || (kind & frame_layout::kPlainLocal) == 0) {
      return FastLocal::kUnknown;
    }
    *value = record->localsplus[i];
    return *value != nullptr ? FastLocal::kValue : FastLocal::kUnbound;
  }
  return FastLocal::kUnknown;
#endif
}

// The caller of `frame`, or a null Ref at the bottom. New reference.
inline Ref frame_back(PyFrameObject* frame) noexcept {
  return Ref::steal(reinterpret_cast<PyObject*>(PyFrame_GetBack(frame)));
}

// The innermost frame of a thread, or a null Ref when it runs none. New reference.
inline Ref tstate_frame(PyThreadState* ts) noexcept {
  return Ref::steal(reinterpret_cast<PyObject*>(PyThreadState_GetFrame(ts)));
}

// Writes a locals mapping edited from C back into the frame's fast locals. From 3.13 on
// frame.f_locals is a write-through proxy, edits are already in place and the interpreter's
// call does nothing; it stays callable there, so the behaviour is right on every version.
inline void locals_to_fast(PyFrameObject* frame, int clear) noexcept {
  PyFrame_LocalsToFast(frame, clear);
}

// ---- Return events -----------------------------------------------------------------------
//
// A return event whose argument is null means the frame is left by an exception. 3.12.1
// passes None instead, which looks like `return None`; there the instruction the frame
// stopped at tells them apart: a frame that really returns or yields stands on
// RETURN_VALUE, RETURN_CONST or YIELD_VALUE. A generator closed while suspended also stands
// on YIELD_VALUE while GeneratorExit unwinds it; that case is recognised by the exception
// event that came just before in the same frame (note_event keeps it, per thread).

// Remembers whether the latest event of a thread was an exception event, and where, in a
// slot the caller keeps per thread.
inline void note_event(PyFrameObject*& last_exception_frame, PyFrameObject* frame,
                       int what) noexcept {
#if PY_VERSION_HEX >= 0x030C0000 && PY_VERSION_HEX < 0x030D0000
  last_exception_frame = what == PyTrace_EXCEPTION ? frame : nullptr;
#else
  (void)last_exception_frame;
  (void)frame;
  (void)what;
#endif
}

#if PY_VERSION_HEX >= 0x030C0000 && PY_VERSION_HEX < 0x030D0000
inline int opcode_at_lasti(PyFrameObject* frame) noexcept {
  int lasti = PyFrame_GetLasti(frame);
  Ref code = Ref::steal(reinterpret_cast<PyObject*>(PyFrame_GetCode(frame)));
  Ref bytes = Ref::steal(PyCode_GetCode(reinterpret_cast<PyCodeObject*>(code.get())));
  if (!bytes) {
    PyErr_Clear();
    return -1;
  }
  if (lasti < 0 || lasti >= PyBytes_GET_SIZE(bytes.get())) return -1;
  return static_cast<unsigned char>(PyBytes_AS_STRING(bytes.get())[lasti]);
}
#endif

// The value a return event carries: null when the frame is left by an exception, on every
// version. Borrowed. `last_exception_frame` is the slot that note_event keeps.
inline PyObject* return_value_of_event(PyFrameObject* last_exception_frame, PyFrameObject* frame,
                                       PyObject* arg) noexcept {
#if PY_VERSION_HEX >= 0x030C0000 && PY_VERSION_HEX < 0x030D0000
  if (arg != Py_None) return arg;
  switch (opcode_at_lasti(frame)) {
    case RETURN_VALUE:
    case RETURN_CONST:
      return arg;
    case YIELD_VALUE:
      return last_exception_frame == frame ? nullptr : arg;
    default:
      return nullptr;
  }
#else
  (void)last_exception_frame;
  (void)frame;
  return arg;
#endif
}

// ---- The interpreter's own frame records (private layout) --------------------------------
//
// Two questions about a running frame have no public answer: was it entered from C code
// (the interpreter started a new evaluation loop for it, so C code lies between it and its
// caller), and which object sits at a given depth of its value stack (a `with` block keeps
// its exit there). Both read the interpreter's frame record, whose head differs per version;
// tests/native/core/test_private_fields.cpp fails where these fields move.

namespace detail {

// The head of a frame object: the pointer to its interpreter frame follows f_back.
struct FrameObjectHead {
  PyObject ob_base;
  PyObject* f_back;
  void* f_frame;
};

#if PY_VERSION_HEX < 0x030C0000
struct InterpFrame {
  PyObject* f_func;
  PyObject* f_globals;
  PyObject* f_builtins;
  PyObject* f_locals;
  PyObject* f_code;
  PyObject* frame_obj;
  InterpFrame* previous;
  void* prev_instr;
  int stacktop;
  bool is_entry;  // set on the frame an evaluation loop started with
  char owner;
  uintptr_t localsplus[1];
};
#elif PY_VERSION_HEX < 0x030E0000
struct InterpFrame {
  PyObject* f_code;
  InterpFrame* previous;
  PyObject* f_funcobj;
  PyObject* f_globals;
  PyObject* f_builtins;
  PyObject* f_locals;
  PyObject* frame_obj;
  void* instr;
  int stacktop;
  uint16_t return_offset;
  char owner;
  uintptr_t localsplus[1];
};
#else
struct InterpFrame {
  uintptr_t f_executable;
  InterpFrame* previous;
  uintptr_t f_funcobj;
  PyObject* f_globals;
  PyObject* f_builtins;
  PyObject* f_locals;
  PyObject* frame_obj;
  void* instr_ptr;
  void* stackpointer;
  uint16_t return_offset;
  char owner;
  uint8_t visited;
  uintptr_t localsplus[1];
};
#endif

// From 3.12 on, an evaluation loop started from C pushes a record of its own below the first
// frame it runs, owned by the C stack (3.12, 3.13: owner 3) or by the interpreter (3.14+:
// owner 3 or above); real frames have owners 0 to 2.
constexpr char kFirstEntryOwner = 3;
// A finished frame whose record its frame object took over: its value stack is cleared.
constexpr char kOwnedByFrameObject = 2;

// Stack slots of 3.14+ carry tag bits in their low bits (reference-count deferral, and from
// 3.15 small ints); an object pointer is the slot without them.
#if PY_VERSION_HEX >= 0x030F0000
constexpr uintptr_t kStackTagBits = 3;
#elif PY_VERSION_HEX >= 0x030E0000
constexpr uintptr_t kStackTagBits = 1;
#else
constexpr uintptr_t kStackTagBits = 0;
#endif

inline InterpFrame* interp_frame(PyFrameObject* frame) noexcept {
  return static_cast<InterpFrame*>(reinterpret_cast<FrameObjectHead*>(frame)->f_frame);
}

}  // namespace detail

// True when the running frame was entered from C code: a builtin, a slot such as
// __getattr__ or __getitem__ called by the interpreter's C code, exec(), an iterator's next.
inline bool frame_entered_from_c(PyFrameObject* frame) noexcept {
  detail::InterpFrame* f = detail::interp_frame(frame);
  if (f == nullptr) return false;
#if PY_VERSION_HEX < 0x030C0000
  return f->is_entry;
#else
  return f->previous != nullptr && f->previous->owner >= detail::kFirstEntryOwner;
#endif
}

// Whether `f(*args, **kwargs)` of a Python function reaches it through the interpreter's C
// call machinery (3.11), which passes every exception on; from 3.12 on such a call enters
// the function directly, and a frame entered from C under it was called by a builtin.
constexpr bool kStarCallGoesThroughC = PY_VERSION_HEX < 0x030C0000;

// The object at `depth` (0 = the bottom) of the frame's value stack. Borrowed. The caller
// must know from the code that the stack holds at least depth + 1 items there (an exception
// table entry covering the frame's instruction guarantees its own depth). Null when the slot
// does not hold an object.
inline PyObject* frame_stack_item(PyFrameObject* frame, int depth) noexcept {
  detail::InterpFrame* f = detail::interp_frame(frame);
  Ref code = Ref::steal(reinterpret_cast<PyObject*>(PyFrame_GetCode(frame)));
  if (f == nullptr || !code || depth < 0 || f->owner == detail::kOwnedByFrameObject) return nullptr;
  int base = reinterpret_cast<PyCodeObject*>(code.get())->co_nlocalsplus;
  uintptr_t slot = f->localsplus[base + depth];
  if ((slot & detail::kStackTagBits) != 0 && detail::kStackTagBits > 1 && (slot & 3) != 1)
    return nullptr;  // a tagged small int or an invalid slot
  return reinterpret_cast<PyObject*>(slot & ~detail::kStackTagBits);
}

// The context manager of the `with` block whose body an exception-table entry of stack depth
// `depth` protects: the block keeps its exit on the value stack just below that depth (a
// bound method up to 3.13; the function and the manager as two items from 3.14 on).
// Borrowed; null when the exit is not a bound method of a Python class.
inline PyObject* with_manager_of(PyFrameObject* frame, int depth) noexcept {
  if (depth < 1) return nullptr;
#if PY_VERSION_HEX >= 0x030E0000
  if (depth < 2 || frame_stack_item(frame, depth - 2) == nullptr) return nullptr;
  return frame_stack_item(frame, depth - 1);
#else
  PyObject* exit = frame_stack_item(frame, depth - 1);
  if (exit == nullptr || !PyMethod_Check(exit)) return nullptr;
  return PyMethod_GET_SELF(exit);
#endif
}

// ---- f_trace -------------------------------------------------------------------------------
//
// Frames are opaque from 3.11 on, so f_trace is an attribute. Going through the frame type's
// own descriptor, found once, spares the attribute lookup on every call event.

inline PyGetSetDef* frame_f_trace_getset() noexcept {
  static PyGetSetDef* getset = [] {
    PyObject* descr = PyObject_GetAttrString(reinterpret_cast<PyObject*>(&PyFrame_Type), "f_trace");
    PyGetSetDef* def = nullptr;
    if (descr != nullptr && Py_IS_TYPE(descr, &PyGetSetDescr_Type)) {
      def = reinterpret_cast<PyGetSetDescrObject*>(descr)->d_getset;
    }
    if (descr == nullptr) PyErr_Clear();
    // The descriptor stays in the frame type's dictionary for the life of the process.
    Py_XDECREF(descr);
    return def;
  }();
  return getset;
}

// New reference to the frame's f_trace (None when unset), or null with an error set.
inline Ref frame_get_trace(PyObject* frame) noexcept {
  PyGetSetDef* getset = frame_f_trace_getset();
  if (getset != nullptr && getset->get != nullptr) {
    return Ref::steal(getset->get(frame, getset->closure));
  }
  return Ref::steal(PyObject_GetAttrString(frame, "f_trace"));
}

// Sets the frame's f_trace (None clears it); 0, or -1 with an error set.
inline int frame_set_trace(PyObject* frame, PyObject* value) noexcept {
  PyGetSetDef* getset = frame_f_trace_getset();
  if (getset != nullptr && getset->set != nullptr)
    return getset->set(frame, value, getset->closure);
  return PyObject_SetAttrString(frame, "f_trace", value);
}

}  // namespace compat

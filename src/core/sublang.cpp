// sublang.cpp: sub-language hooks (see sublang.h).
//
// Hooks are registered without asking them anything: the implementation's modules may not be
// imported yet. Each call event retries the pending hooks until all three of their lists are
// non-empty; the lists are read once, and the dictionaries only grow.
//
// Every hook method runs Python code: the calling thread enters the debugger first (the
// selvane mutex), and the pending error of the event is kept around the call, whatever the
// method raises.
#include "core/sublang.h"

#include <cstdint>
#include <cstring>

#include "bp/breakhere.h"
#include "core/dispatch.h"
#include "core/tracercore.h"
#include "names/conames.h"
#include "support/dbgcommon.h"
#include "support/dprintf.h"
#include "support/pycompat.h"
#include "threads/threadops.h"

namespace {

SubLanguageState& state() {
  return gSelf.sub_language;
}

// The frame's code object (new reference), or null for what is not a plain frame.
Ref code_of(PyObject* frame) {
  if (!compat::is_plain_frame(frame)) return Ref();
  return Ref::steal(
      reinterpret_cast<PyObject*>(PyFrame_GetCode(reinterpret_cast<PyFrameObject*>(frame))));
}

// dict[key] (new reference), or null; a failed lookup counts as "not there".
Ref lookup(const Ref& dict, PyObject* key) {
  if (!dict || key == nullptr) return Ref();
  Ref found = Ref::borrow(PyDict_GetItemWithError(dict.get(), key));
  if (!found) PyErr_Clear();
  return found;
}

// Calls a hook method with the event's pending error kept aside. Null when the method is
// missing or raised; its error is written to the debug channel and dropped.
template <typename... Args>
Ref call_hook(PyObject* hook, const char* method, const char* format, Args... args) {
  enter_debugger();
  compat::PendingError saved;
  saved.fetch();
  Ref result = Ref::steal(PyObject_CallMethod(hook, method, format, args...));
  if (!result) {
    do_dprintf(kDbgFlow, "sub-language hook method %s failed\n", method);
    DLOGEXCEPTION();
    PyErr_Clear();
  }
  saved.restore();
  return result;
}

// ---- Which hook a code object belongs to -------------------------------------------------

void reset_cache(CU_HashTable* cache) {
  if (cache->buckets != nullptr) CU_DeleteHashTable(cache);
  // Keys are code object addresses: a whole pointer on every platform we build for.
  CU_InitHashTable(cache, sizeof(void*));
}

// The dictionaries changed: what the caches say may be wrong, and their hooks may be gone.
void forget_roles() {
  reset_cache(&state().marker_cache);
  reset_cache(&state().key_cache);
}

void forget_code_in(CU_HashTable* cache, const PyObject* code) {
  if (cache->num_entries == 0) return;
  CU_HashEntry* entry = CU_FindHashEntry(cache, &code);
  if (entry != nullptr) CU_DeleteHashEntry(entry);
}

// dict[code] through the cache (borrowed), or null. Only code objects that the pathname
// table holds are cached: it keeps their addresses from being reused while the entry lives,
// and tells us when it lets one go.
PyObject* hook_of_code(CU_HashTable* cache, const Ref& dict, PyObject* code) {
  if (!dict || code == nullptr) return nullptr;
  CU_HashEntry* entry = CU_FindHashEntry(cache, &code);
  if (entry != nullptr) {
    auto* hook = static_cast<PyObject*>(CU_GetHashValue(entry));
    return hook == Py_None ? nullptr : hook;
  }
  PyObject* hook = PyDict_GetItemWithError(dict.get(), code);
  if (hook == nullptr) PyErr_Clear();
  if (LookupCOPathname(&gSelf.co_pathname_table, code) == nullptr) {
    PyErr_Clear();
    return hook;
  }
  int is_new = 0;
  entry = CU_CreateHashEntry(cache, &code, &is_new);
  if (entry != nullptr) CU_SetHashValue(entry, hook != nullptr ? hook : Py_None);
  return hook;
}

Ref marker_hook(PyObject* code) {
  return Ref::borrow(hook_of_code(&state().marker_cache, state().marker_frames, code));
}

Ref key_hook(PyObject* code) {
  return Ref::borrow(hook_of_code(&state().key_cache, state().key_frames, code));
}

// The non-empty list a hook method answered, or null. Results are meant to be lists; anything
// else counts as a failure rather than being read as one.
Ref call_for_list(PyObject* hook, const char* method) {
  Ref list = call_hook(hook, method, nullptr);
  if (!list) return Ref();
  if (!PyList_Check(list.get())) {
    do_dprintf(kDbgFlow, "sub-language hook method %s did not answer a list\n", method);
    return Ref();
  }
  return PyList_GET_SIZE(list.get()) > 0 ? list : Ref();
}

// dict[item] = hook for every item of the list; false at the first failure.
bool map_items_to_hook(const Ref& dict, const Ref& list, PyObject* hook) {
  if (!dict) return false;
  forget_roles();
  // A snapshot: setting items can run the items' own hashing code, which may change the list.
  Ref items = Ref::steal(PyList_AsTuple(list.get()));
  if (!items) {
    PyErr_Clear();
    return false;
  }
  for (Py_ssize_t i = 0; i < PyTuple_GET_SIZE(items.get()); ++i) {
    if (PyDict_SetItem(dict.get(), PyTuple_GET_ITEM(items.get(), i), hook) < 0) {
      PyErr_Clear();
      return false;
    }
  }
  return true;
}

// Markers, module paths and key frames, in that order; false leaves the hook pending (what
// was already stored stays).
bool load_hook(PyObject* hook) {
  SubLanguageState& s = state();
  Ref markers = call_for_list(hook, "_GetMarkerFrames");
  if (!markers || !map_items_to_hook(s.marker_frames, markers, hook)) return false;
  Ref paths = call_for_list(hook, "_GetModulePaths");
  if (!paths || !s.module_paths) return false;
  if (PyDict_SetItem(s.module_paths.get(), hook, paths.get()) < 0) {
    PyErr_Clear();
    return false;
  }
  return __tracer_load_sub_language_frames(hook) != 0;
}

void release_state(SubLanguageState* s) {
  s->enabled = 0;
  s->pending_hooks.reset();
  s->marker_frames.reset();
  s->module_paths.reset();
  s->key_frames.reset();
}

bool make_if_missing(Ref& field, PyObject* (*make)()) {
  if (!field) field = Ref::steal(make());
  return static_cast<bool>(field);
}

PyObject* new_empty_list() {
  return PyList_New(0);
}

// The cached implementation test result of a code object.
bool cached_impl_value(const PyObject* code, int* value) {
  CU_HashEntry* entry = CU_FindHashEntry(&state().impl_cache, &code);
  if (entry == nullptr) return false;
  *value = static_cast<int>(reinterpret_cast<intptr_t>(CU_GetHashValue(entry)));
  return true;
}

void cache_impl_value(const PyObject* code, int value) {
  int is_new = 0;
  CU_HashEntry* entry = CU_CreateHashEntry(&state().impl_cache, &code, &is_new);
  // Without memory the answer is simply computed again next time.
  if (entry != nullptr)
    CU_SetHashValue(entry, reinterpret_cast<void*>(static_cast<intptr_t>(value)));
}

// The int of the first (prefix, int) pair whose prefix begins `path`, or 0. Pairs of any
// other shape are passed over.
int value_for_path(PyObject* paths, const char* path) {
  if (!PyList_Check(paths)) return 0;
  for (Py_ssize_t i = 0; i < PyList_GET_SIZE(paths); ++i) {
    PyObject* pair = PyList_GET_ITEM(paths, i);
    if (!PyTuple_Check(pair) || PyTuple_GET_SIZE(pair) < 2) continue;
    const char* prefix = _pystring_to_c_string(PyTuple_GET_ITEM(pair, 0));
    if (prefix == nullptr) {
      PyErr_Clear();
      continue;
    }
    if (std::strncmp(path, prefix, std::strlen(prefix)) != 0) continue;
    long value = PyLong_AsLong(PyTuple_GET_ITEM(pair, 1));
    if (value == -1 && PyErr_Occurred() != nullptr) {
      PyErr_Clear();
      continue;
    }
    return static_cast<int>(value);
  }
  return 0;
}

}  // namespace

void __tracer_init_sub_language_state(SubLanguageState* s) {
  release_state(s);
  reset_cache(&s->impl_cache);
  reset_cache(&s->marker_cache);
  reset_cache(&s->key_cache);
}

void __tracer_sub_language_forget_code(const PyObject* code) {
  SubLanguageState& s = state();
  if (s.impl_cache.buckets == nullptr) return;  // before the state is first set up
  if (code == nullptr) {
    reset_cache(&s.impl_cache);
    forget_roles();
    return;
  }
  forget_code_in(&s.impl_cache, code);
  forget_code_in(&s.marker_cache, code);
  forget_code_in(&s.key_cache, code);
}

int __tracer_register_sub_language_hook(PyObject* hook) {
  SubLanguageState& s = state();
  if (!make_if_missing(s.pending_hooks, new_empty_list) ||
      !make_if_missing(s.marker_frames, PyDict_New) ||
      !make_if_missing(s.module_paths, PyDict_New) || !make_if_missing(s.key_frames, PyDict_New)) {
    compat::PendingError failure;
    failure.fetch();
    release_state(&s);
    failure.restore();
    return -1;
  }
  if (PyList_Append(s.pending_hooks.get(), hook) < 0) return -1;
  s.enabled = 1;
  return 0;
}

int __tracer_load_sub_language_frames(PyObject* hook) {
  SubLanguageState& s = state();
  if (!s.key_frames) return 0;
  Ref frames = call_for_list(hook, "_GetSubLanguageFrames");
  return frames && map_items_to_hook(s.key_frames, frames, hook) ? 1 : 0;
}

void __tracer_load_pending_sub_language_hooks() {
  SubLanguageState& s = state();
  if (!s.pending_hooks) return;
  static bool loading = false;  // a hook method that calls back into us loads nothing more
  if (loading) return;
  loading = true;
  Ref pending = s.pending_hooks;
  Ref hooks = Ref::steal(PyList_AsTuple(pending.get()));
  Ref still_pending = Ref::steal(PyList_New(0));
  if (!hooks || !still_pending) {
    PyErr_Clear();
    loading = false;
    return;
  }
  for (Py_ssize_t i = 0; i < PyTuple_GET_SIZE(hooks.get()); ++i) {
    PyObject* hook = PyTuple_GET_ITEM(hooks.get(), i);
    if (!load_hook(hook) && PyList_Append(still_pending.get(), hook) < 0) PyErr_Clear();
  }
  // The hooks' own code may have registered more hooks (kept), or started a new session
  // (whose state is not ours to replace).
  if (s.pending_hooks.is(pending.get())) {
    for (Py_ssize_t i = PyTuple_GET_SIZE(hooks.get()); i < PyList_GET_SIZE(pending.get()); ++i) {
      if (PyList_Append(still_pending.get(), PyList_GET_ITEM(pending.get(), i)) < 0) PyErr_Clear();
    }
    s.pending_hooks = PyList_GET_SIZE(still_pending.get()) > 0 ? still_pending : Ref();
  }
  loading = false;
}

void __tracer_sub_language_dispatch_call(ThreadData* data, PyObject* frame) {
  SubLanguageState& s = state();
  if (!s.enabled) return;
  if (s.pending_hooks) __tracer_load_pending_sub_language_hooks();
  // A marker called inside an active sub-language does not replace the outer one.
  if (data->sub_language_frame || !s.marker_frames) return;
  Ref code = code_of(frame);
  Ref hook = marker_hook(code.get());
  if (!hook) return;
  data->sub_language_frame = Ref::borrow(frame);
  data->sub_language_hook = std::move(hook);
}

void __tracer_sub_language_dispatch_return(ThreadData* data, PyObject* frame) {
  if (!data->sub_language_frame.is(frame)) return;
  enter_debugger();  // the hook may be the last reference to code that runs when released
  Ref hook = std::move(data->sub_language_hook);
  Ref marker = std::move(data->sub_language_frame);
}

int __tracer_sub_language_get_action(ThreadData* data) {
  if (!data->stop_frame) return -1;
  if (data->step_out_frame && !data->step_out_frame.is_none()) return 2;
  if (data->stop_frame.is_none()) return 0;
  Ref code = code_of(data->stop_frame.get());
  return key_hook(code.get()) ? 1 : -1;
}

int __tracer_sub_language_stop_here(ThreadData* data, PyObject* frame, int event) {
  if (!gSelf.trace_started || !data->sub_language_hook) return 0;
  Ref code = code_of(frame);
  Ref hook = key_hook(code.get());
  if (!hook) return 0;
  int action = __tracer_sub_language_get_action(data);
  Ref answer = call_hook(hook.get(), "_StopHere", "Oii", frame, event, action);
  int wanted = answer ? PyObject_IsTrue(answer.get()) : 0;
  if (wanted < 0) PyErr_Clear();
  // The breakpoint test also runs when the hook stops for its own reasons: it keeps the hit
  // counts of breakpoints on the line current, as stepping stops in Python code do.
  int hit = __tracer_break_here(&gSelf.bp_ops_data, event, data, frame, 1);
  return wanted > 0 || hit ? 1 : 0;
}

int __tracer_sub_language_in_impl(ThreadData* data, PyObject* frame) {
  if (!data->sub_language_hook) return 0;
  Ref code = code_of(frame);
  if (!code) return 0;
  int value = 0;
  if (cached_impl_value(code.get(), &value)) return value;
  SubLanguageState& s = state();
  if (!s.module_paths) return 0;
  enter_debugger();  // the hook is a dictionary key: its own hashing code may run
  Ref paths = lookup(s.module_paths, data->sub_language_hook.get());
  if (!paths) return 0;
  const char* path = LookupCOPathname(&gSelf.co_pathname_table, code.get());
  if (path == nullptr) return PyErr_Occurred() != nullptr ? -1 : 0;
  // Only code objects that the pathname table holds are cached: it keeps their addresses
  // from being reused while the entry lives, and tells us when it lets one go.
  value = value_for_path(paths.get(), path);
  cache_impl_value(code.get(), value);
  return value;
}

int __tracer_sub_language_get_frame_category(ThreadData* data, PyObject* frame) {
  if (data == nullptr || !data->sub_language_hook) return -1;
  Ref code = code_of(frame);
  if (!code) return -1;
  if (key_hook(code.get())) return 1;
  int in_impl = __tracer_sub_language_in_impl(data, frame);
  if (in_impl == -1 && PyErr_Occurred() != nullptr) {
    PyErr_Clear();
    return -1;
  }
  return in_impl != 0 ? 0 : -1;
}

PyObject* __tracer_sub_language_step_out_frame(ThreadData* data, PyObject* frame) {
  Ref hook = data->sub_language_hook;
  enter_debugger();
  return PyObject_CallMethod(hook.get(), "_GetStepOutFrame", "O", frame);
}

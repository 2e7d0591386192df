// tracercore.cpp: the global tracer record gSelf, its initialisation, reset and destroy,
// and the bookkeeping of the frame at which each thread stands.
#include "core/tracercore.h"

#include <unistd.h>

#include "core/idleticker.h"
#include "core/imports.h"
#include "core/install.h"
#include "support/dprintf.h"
#include "support/pycompat.h"
#include "threads/threadops.h"

namespace {
NoDestructor<TracerState> gStateStorage;

// Deletes a table that an earlier init made, so that a repeated init does not lose its
// entries' memory; a table never made is all zeros.
void reinit_table(CU_HashTable* table, int key_type) {
  if (table->buckets != nullptr) CU_DeleteHashTable(table);
  CU_InitHashTable(table, key_type);
}

void store_callbacks(TracerState& s, PyObject* install_thread_hooks_cb, PyObject* idle_cb,
                     PyObject* line_cb, PyObject* return_cb, PyObject* exception_cb,
                     PyObject* quit_cb, PyObject* import_cb, PyObject* default_import,
                     PyObject* internal_modules_map) {
  // A repeated init overwrites these without releasing the earlier references: a server
  // side that re-initialises from inside one of its callbacks must not see that callback's
  // objects disappear under it. The cost is a fixed number of references per init.
  Ref* fields[] = {&s.install_thread_hooks_cb,
                   &s.idle_cb,
                   &s.line_cb,
                   &s.return_cb,
                   &s.exception_cb,
                   &s.quit_cb,
                   &s.import_cb,
                   &s.default_import,
                   &s.internal_modules_map};
  PyObject* values[] = {install_thread_hooks_cb,
                        idle_cb,
                        line_cb,
                        return_cb,
                        exception_cb,
                        quit_cb,
                        import_cb,
                        default_import,
                        internal_modules_map};
  for (size_t i = 0; i < sizeof fields / sizeof fields[0]; ++i) {
    fields[i]->forget();
    *fields[i] = Ref::borrow(values[i]);
  }
}

// An attribute the core may find missing: the field then holds null and its users cope.
Ref optional_attr(PyObject* obj, const char* name) {
  Ref value = Ref::steal(PyObject_GetAttrString(obj, name));
  if (!value) PyErr_Clear();
  return value;
}

// A repeated init keeps the mutex and its owner, unlike a literal "allocate a new one":
// threads already waiting on the old mutex would never wake, and an init made from a
// callback would lose the release of the mutex its own thread holds (a deadlock seen with
// init and start_trace from a line callback while a worker ran). Only a forked child whose
// mutex is held by a thread that did not survive the fork gets a new one.
void keep_or_make_thread_mutex(TracerState& s, bool forked_child) {
  bool held_by_vanished_thread = forked_child && s.selvane_mutex_owner != kNoMutexOwner &&
                                 s.selvane_mutex_owner != get_thread_ident();
  if (s.thread_mutex != nullptr && !held_by_vanished_thread) return;
  // Nobody in this process waits on a mutex whose holder vanished in the fork.
  if (s.thread_mutex != nullptr) PyThread_free_lock(s.thread_mutex);
  s.thread_mutex = allocate_thread_mutex();
  s.selvane_mutex_owner = kNoMutexOwner;
}

void forget_run_control(TracerState& s) {
  s.autoquit = 1;
  s.debug_all_threads = 1;
  s.debug_thread_cb.reset();
  reinit_table(&s.debug_thread_map, sizeof(unsigned long));
}

}  // namespace

TracerState& gSelf = gStateStorage.get();

int init_tracercore() {
  // Empty tables from the start, so that queries made before init answer "nothing known".
  init_thread_table(&gSelf.thread_table);
  CU_InitHashTable(&gSelf.debug_thread_map, sizeof(unsigned long));
  gSelf.file_ops_data = create_file_ops_data();
  if (gSelf.file_ops_data == nullptr) return -1;
  InitCOPathnameTable(&gSelf.co_pathname_table, gSelf.file_ops_data);
  __tracer_init_sub_language_state(&gSelf.sub_language);
  // The sub-language implementation cache is keyed by code address, as the table is.
  gSelf.co_pathname_table.code_released = __tracer_sub_language_forget_code;
  return 0;
}

int __tracer_init(PyObject* module, float idle_period, int exception_mode,
                  PyObject* install_thread_hooks_cb, PyObject* idle_cb, PyObject* line_cb,
                  PyObject* return_cb, PyObject* exception_cb, PyObject* quit_cb,
                  PyObject* import_cb, PyObject* default_import, PyObject* dprintf_file,
                  PyObject* internal_modules_map) {
  TracerState& s = gSelf;
  set_dprintf_file(dprintf_file);
  do_dprintf(kDbgFlow, "INIT CORE\n");
  s.trace_started = 0;
  s.idle_period = idle_period;
  s.in_idle = 0;
  s.exception_mode = exception_mode;
  store_callbacks(s, install_thread_hooks_cb, idle_cb, line_cb, return_cb, exception_cb, quit_cb,
                  import_cb, default_import, internal_modules_map);

  bool forked_child = s.pid != 0 && s.pid != getpid();
  if (forked_child) drop_pins_of_vanished_threads(&s.thread_table, compat::current_tstate());
  // Records of threads inside an event stay (renewed); the others go.
  if (s.thread_table.buckets != nullptr) {
    clear_thread_table(&s.thread_table);
  } else {
    init_thread_table(&s.thread_table);
  }
  s.pending_exception_count = 0;  // the records that held them are gone
  keep_or_make_thread_mutex(s, forked_child);

  s.module = Ref::borrow(module);
  s.trace_dispatch = optional_attr(module, "trace_dispatch");
  Ref sys_module = Ref::steal(PyImport_ImportModule("sys"));
  if (!sys_module) return 0;
  s.sys_module = sys_module;
  s.sys_settrace = optional_attr(sys_module.get(), "settrace");
  s.sys_exc_info = optional_attr(sys_module.get(), "exc_info");

  s.always_stop_excepts.reset();
  s.never_stop_excepts.reset();
  s.ignored_exception_handlers.reset();
  s.spare_ref.reset();
  forget_run_control(s);
  s.idle_tick = 0;
  s.idle_tick_limit = 10;
  s.next_idle_time = 0;

  __tracer_init_bp_ops_data(&s.bp_ops_data, &s.co_pathname_table);
  // A repeated init empties the filters of the earlier session instead of losing them.
  if (s.exc_filters.table.buckets != nullptr) {
    __tracer_clear_exception_filters(&s.exc_filters);
  } else {
    __tracer_init_exception_filters(&s.exc_filters);
  }
  Ref new_imports = Ref::steal(PyList_New(0));
  if (!new_imports) return 0;
  s.new_imports = new_imports;
  s.new_imports_listed.reset();
  s.installed_import_hook.reset();
  s.in_import_cb = 0;
  s.import_hook_depth = 0;
  __tracer_install_import_hook();
  // A hook that cannot be installed (above all: the default import given is our own hook)
  // fails init once the remaining fields are set.
  bool hook_failed = PyErr_Occurred() != nullptr;
  __tracer_init_sub_language_state(&s.sub_language);
  s.instruction_count = 0;
  s.import_hook_calls = 0;
  s.pid = getpid();
  // A forked child that initialises starts a session of its own: it is traced again.
  s.in_forked_child = 0;
  init_exc_data(&s.exc_data);
  idle_ticker_update();  // tracing is not started after init: a ticker of the earlier session ends
  return hook_failed ? 0 : 1;
}

void __tracer_reset() {
  TracerState& s = gSelf;
  __tracer_stop_trace();
  do_dprintf(kDbgFlow, "RESET THREAD TABLE\n");
  clear_thread_table(&s.thread_table);
  // Injected exceptions went with their records; a stale count would make every later event
  // look for one.
  s.pending_exception_count = 0;
  __tracer_clear_exception_filters(&s.exc_filters);
  __tracer_clear_bp_ops_data(&s.bp_ops_data, &s.co_pathname_table);
  Ref new_imports = Ref::steal(PyList_New(0));
  if (new_imports) {
    s.new_imports = new_imports;
    s.new_imports_listed.reset();
  } else {
    PyErr_Clear();  // keep the old list rather than none: get_new_imports still answers
  }
  forget_run_control(s);
  s.always_stop_excepts.reset();
  s.never_stop_excepts.reset();
  s.ignored_exception_handlers.reset();
  reset_exc_data(&s.exc_data);
}

void __tracer_destroy() {
  do_dprintf(kDbgFlow, "DESTROY REACHED\n");
  __tracer_reset();
  gSelf.spare_ref.reset();
}

namespace {
ThreadData* current_thread_record() {
  PyThreadState* ts = compat::current_tstate();
  if (ts == nullptr) return nullptr;
  ThreadData* data = insert_thread_data(&gSelf.thread_table, ts);
  if (data == nullptr) {
    DLOGEXCEPTION();
    PyErr_Clear();
  }
  return data;
}
}  // namespace

void __tracer_set_curr_frame(PyObject* frame) {
  ThreadData* data = current_thread_record();
  if (data != nullptr) data->curr_frame = Ref::borrow(frame);
}

void __tracer_clear_curr_frame() {
  ThreadData* data = current_thread_record();
  if (data != nullptr) data->curr_frame = Ref::none();
}

void __tracer_forget_thread(PyThreadState* tstate) {
  ThreadData* data = find_thread_data(&gSelf.thread_table, tstate);
  if (data == nullptr) return;
  if (data->pending_exception) --gSelf.pending_exception_count;
  remove_thread_data(&gSelf.thread_table, tstate);
}

// tracercore.h: the one global tracer record and its lifecycle.
//
// gSelf is a static record, never allocated: the tables of the other subsystems are
// embedded in it and their owners are handed the member's address. Everything the core
// knows between two trace events lives here or in the per-thread records.
#pragma once

#include <Python.h>
#include <pythread.h>

#include <sys/types.h>

#include <cstdint>
#include <ctime>

#include "bp/bpops.h"
#include "core/sublang.h"
#include "exc/exceptops.h"
#include "exc/usercode.h"
#include "names/conames.h"
#include "support/hashtable.h"
#include "support/ref.h"

enum ExceptionMode : int {
  kExcNeverStop = 0,
  kExcAlwaysStop = 1,
  kExcUnhandledStop = 2,
  // Also stops where an exception leaves the program's own code into library code that ends
  // it (a test failing under a test runner that catches everything).
  kExcUserUnhandledStop = 3,
};

// selvane_mutex_owner when nobody holds the mutex.
constexpr unsigned long kNoMutexOwner = static_cast<unsigned long>(-1);

// Where events come from: the interpreter's trace function, or sys.monitoring (3.12+).
enum EventSource : int32_t {
  kEventsFromTrace = 0,
  kEventsFromMonitoring = 1,
};

struct TracerState {
  int trace_started = 0;
  // Chosen at init (SELVANE_EVENT_SOURCE); start_trace puts it in force, and the source in
  // force is the one stop_trace takes down.
  EventSource requested_event_source = kEventsFromTrace;
  EventSource event_source = kEventsFromTrace;
  float idle_period = 0;  // seconds; 0 or less turns the idle callback off
  int in_idle = 0;
  int exception_mode = kExcNeverStop;
  int autoquit = 0;
  int debug_all_threads = 0;
  Ref debug_thread_cb;            // owned or null
  CU_HashTable debug_thread_map;  // thread identity -> cached decision (0 or 1)
  CU_HashTable thread_table;      // thread state -> ThreadData
  PyThread_type_lock thread_mutex = nullptr;
  unsigned long selvane_mutex_owner = kNoMutexOwner;
  Ref install_thread_hooks_cb;  // owned (all callbacks below too)
  Ref idle_cb;
  Ref line_cb;
  Ref return_cb;
  Ref exception_cb;
  Ref quit_cb;
  Ref internal_modules_map;  // owned dict of the debugger's own modules
  Ref module;                // owned: this extension module
  Ref trace_dispatch;        // owned: the module's Python-level trace function
  Ref sys_module;
  Ref sys_settrace;
  Ref sys_exc_info;
  int idle_tick = 0;
  int idle_tick_limit = 10;
  time_t next_idle_time = 0;
  ExcFilters exc_filters;
  Ref spare_ref;                         // owned or null; only destroy releases it
  FileOpsData* file_ops_data = nullptr;  // owned, made at module load
  BpOpsData bp_ops_data;
  Ref new_imports;            // owned list of full path names
  Ref new_imports_listed;     // owned set of the paths in new_imports once it is full, or null
  Ref installed_import_hook;  // the replacement __import__ once installed, or null
  Ref default_import;         // owned: the builtins' own __import__
  Ref import_cb;              // owned: None or callable
  int16_t in_import_cb = 0;
  int import_hook_depth = 0;
  COPathnameTable co_pathname_table;
  Ref always_stop_excepts;         // owned tuple or null
  Ref never_stop_excepts;          // owned tuple or null
  Ref ignored_exception_handlers;  // owned dict or null
  SubLanguageState sub_language;
  // Event counter; unsigned so that a long run wraps instead of overflowing.
  uint32_t instruction_count = 0;
  uint32_t import_hook_calls = 0;
  pid_t pid = 0;
  ExcData exc_data;
  UserCode user_code;  // which code is library code, for kExcUserUnhandledStop
  int pending_exception_count = 0;
  // Set on the first event seen in a forked child of the process that called init: nothing
  // is traced there. Learnt from a fork handler, so the hot path never asks for the pid.
  int in_forked_child = 0;
};

extern TracerState& gSelf;

int init_tracercore();
int __tracer_init(PyObject* module, float idle_period, int exception_mode,
                  PyObject* install_thread_hooks_cb, PyObject* idle_cb, PyObject* line_cb,
                  PyObject* return_cb, PyObject* exception_cb, PyObject* quit_cb,
                  PyObject* import_cb, PyObject* default_import, PyObject* dprintf_file,
                  PyObject* internal_modules_map);
void __tracer_reset();
void __tracer_destroy();
void __tracer_set_curr_frame(PyObject* frame);
// Removes a thread's record, giving up an exception still pending for it.
void __tracer_forget_thread(PyThreadState* tstate);
void __tracer_clear_curr_frame();

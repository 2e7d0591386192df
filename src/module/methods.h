// methods.h: the C functions behind the module's Python methods, grouped by the file that
// defines them. Each wrapper parses its arguments, calls the core and converts the result.
#pragma once

#include <Python.h>

// vantrelmodule.cpp: makes the submodule that `def` describes (named "<main>.<name>"), sets
// it on `parent` as <name> and puts it in sys.modules. 0, or -1 with the error set.
int add_submodule(PyObject* parent, PyModuleDef* def);

// analysis_module.cpp: makes the submodule `analysis` and sets it on the main module and in
// sys.modules. 0, or -1 with the error set.
int add_analysis_module(PyObject* parent);
// breakpoints_module.cpp: the submodule `breakpoints`, added to `parent` and sys.modules.
// 0, or -1 with an error set.
int add_breakpoints_module(PyObject* parent);

// vantrelmodule.cpp: lifecycle.
PyObject* _tracer_init(PyObject* self, PyObject* args);
PyObject* _tracer_reset(PyObject* self, PyObject* args);
PyObject* _tracer_destroy(PyObject* self, PyObject* args);

// runcontrol_methods.cpp: run-control settings, thread queries, the selvane mutex.
PyObject* _tracer_set_autoquit(PyObject* self, PyObject* args);
PyObject* _tracer_set_idle_period(PyObject* self, PyObject* args);
PyObject* _tracer_set_debug_all_threads(PyObject* self, PyObject* args);
PyObject* _tracer_set_debug_thread_cb(PyObject* self, PyObject* args);
PyObject* _tracer_get_threads(PyObject* self, PyObject* args);
PyObject* _tracer_get_curr_frame(PyObject* self, PyObject* args);
PyObject* _tracer_get_thread_name(PyObject* self, PyObject* args);
PyObject* _tracer_is_botframe(PyObject* self, PyObject* args);
PyObject* get_tracing(PyObject* self, PyObject* args);
PyObject* _tracer_acquire_selvane_mutex(PyObject* self, PyObject* args);
PyObject* _tracer_release_selvane_mutex(PyObject* self, PyObject* args);

// tstate_methods.cpp: thread-state and frame utilities.
PyObject* locals_to_fast(PyObject* self, PyObject* args);
PyObject* wrap_PyFrame_LocalsToFast(PyObject* self, PyObject* args);
PyObject* get_frame_file(PyObject* self, PyObject* args);
PyObject* get_current_tstate_id(PyObject* self, PyObject* args);
PyObject* get_thread_ident_for_tstate_id(PyObject* self, PyObject* args);
PyObject* add_to_tstate_tracing(PyObject* self, PyObject* args);
PyObject* get_tstate_tracing(PyObject* self, PyObject* args);
PyObject* set_tstate_use_tracing(PyObject* self, PyObject* args);
PyObject* get_tstate_use_tracing(PyObject* self, PyObject* args);

// trace_methods.cpp: tracing on and off, stepping commands, thread hooks, raise_exception.
PyObject* _tracer_start_trace(PyObject* self, PyObject* args);
PyObject* _tracer_stop_trace(PyObject* self, PyObject* args);
PyObject* _tracer_step_into(PyObject* self, PyObject* args);
PyObject* _tracer_step_over(PyObject* self, PyObject* args);
PyObject* _tracer_step_over_line(PyObject* self, PyObject* args);
PyObject* _tracer_step_over_line_range(PyObject* self, PyObject* args);
PyObject* _tracer_step_out(PyObject* self, PyObject* args);
PyObject* _tracer_continue_run(PyObject* self, PyObject* args);
PyObject* _tracer_stop(PyObject* self, PyObject* args);
PyObject* _tracer_bootstrap_new_thread(PyObject* self, PyObject* args);
PyObject* _tracer_thread_exiting(PyObject* self, PyObject* args);
PyObject* _tracer_is_internal_frame(PyObject* self, PyObject* args);
PyObject* raise_exception(PyObject* self, PyObject* args);

// exception_methods.cpp: the settings of the exception decision.
PyObject* set_always_stop_excepts(PyObject* self, PyObject* args);
PyObject* get_always_stop_excepts(PyObject* self, PyObject* args);
PyObject* set_never_stop_excepts(PyObject* self, PyObject* args);
PyObject* get_never_stop_excepts(PyObject* self, PyObject* args);
PyObject* _tracer_set_exception_mode(PyObject* self, PyObject* args);
PyObject* _tracer_get_exception_mode(PyObject* self, PyObject* args);
PyObject* _tracer_ignore_exception_loc(PyObject* self, PyObject* args);
PyObject* _tracer_exception_loc_ignored(PyObject* self, PyObject* args);
PyObject* _tracer_clear_exception_ignores(PyObject* self, PyObject* args);
PyObject* _tracer_exiting_on_exception(PyObject* self, PyObject* args);
PyObject* set_ignored_exception_handlers(PyObject* self, PyObject* args);
PyObject* set_exc_catch_info_list(PyObject* self, PyObject* args);

// import_methods.cpp: newly imported modules, the import callback, the replacement __import__.
PyObject* _tracer_get_new_imports(PyObject* self, PyObject* args);
PyObject* _tracer_set_import_cb(PyObject* self, PyObject* args);
PyObject* _tracer_register_module(PyObject* self, PyObject* args);
PyObject* _tracer_register_sub_language_hook(PyObject* self, PyObject* args);
PyObject* _tracer_sub_language_get_active_hook(PyObject* self, PyObject* args);
PyObject* _tracer_sub_language_get_frame_category(PyObject* self, PyObject* args);
PyObject* _tracer_import(PyObject* self, PyObject* args, PyObject* kwargs);

// bp_methods.cpp: breakpoints.
PyObject* _tracer_set_break(PyObject* self, PyObject* args);
PyObject* _tracer_clear_breaks(PyObject* self, PyObject* args);
PyObject* _tracer_enable_breaks(PyObject* self, PyObject* args);
PyObject* _tracer_ignore_breaks(PyObject* self, PyObject* args);
PyObject* _tracer_set_breaks_cond(PyObject* self, PyObject* args);
PyObject* _tracer_clear_all_breaks(PyObject* self, PyObject* args);
PyObject* _tracer_get_breaks(PyObject* self, PyObject* args);
PyObject* _tracer_get_file_breaks(PyObject* self, PyObject* args);
PyObject* get_changed_bps_lists(PyObject* self, PyObject* args);

// io_methods.cpp: waiting for the program's input or the debug connection, buffer copy.
PyObject* WrapWaitForInput(PyObject* self, PyObject* args);
PyObject* WrapCopyIntoBuffer(PyObject* self, PyObject* args);

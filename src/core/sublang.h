// sublang.h: sub-language hooks: languages implemented in Python (a template language, a
// rules language) whose programs the debugger steps through and stops in as programs of
// their own.
//
// The server side registers one hook object per sub-language. Through it the core learns the
// marker frames (code objects whose calls enter the sub-language), the key frames (code
// objects each call of which stands for one step of the sub-language program) and the
// implementation's files (whose other frames are hidden and never stop). While a thread runs
// below a marker frame, the hook is the thread's active hook: stop decisions at key frames
// are delegated to it, and breakpoints are tested at the file and line it translates a key
// frame into.
//
// The hook's methods are called by name: _GetMarkerFrames(), _GetModulePaths(),
// _GetSubLanguageFrames(), _StopHere(frame, event, action), _TranslateFrame(frame, flag),
// _Eval(condition, frame) and _GetStepOutFrame(frame). Whatever they do, nothing reaches
// the traced program: a failing method leaves its hook pending, or answers "do not stop" or
// "unknown frame".
#pragma once

#include <Python.h>

#include <cstdint>

#include "support/hashtable.h"
#include "support/ref.h"

struct SubLanguageState {
  int32_t enabled = 0;      // 1 once a hook was registered
  Ref pending_hooks;        // owned list of hooks not fully loaded yet, or null
  Ref marker_frames;        // owned dict: code object -> hook
  Ref module_paths;         // owned dict: hook -> its list of (path prefix, int)
  Ref key_frames;           // owned dict: code object -> hook
  CU_HashTable impl_cache;  // code object address -> implementation test result
  // Code object address -> its hook in marker_frames / key_frames, or None when it has none
  // (borrowed from the dictionaries, emptied whenever they change). A code object hashes its
  // whole contents, which costs a microsecond on current interpreters: far too much for every
  // call and line event, so each code object is looked up in the dictionaries once.
  CU_HashTable marker_cache;
  CU_HashTable key_cache;
};

struct ThreadData;

// Empties the state (hooks, dictionaries and cache): a new session knows no hooks.
void __tracer_init_sub_language_state(SubLanguageState* state);
// Forgets what the cache knows of a code object that is being released (null: of every code
// object), so that a later code object at the same address starts afresh.
void __tracer_sub_language_forget_code(const PyObject* code);

// register_sub_language_hook: 0, or -1 with an error set (the state then knows no hooks).
int __tracer_register_sub_language_hook(PyObject* hook);
// Reads the hook's key frames; 1 when it has some, 0 otherwise (errors cleared).
int __tracer_load_sub_language_frames(PyObject* hook);
// Asks every pending hook for its lists; a hook stays pending until all three are non-empty.
void __tracer_load_pending_sub_language_hooks();

// A call event: loads pending hooks and makes a marker frame's hook the thread's active one.
void __tracer_sub_language_dispatch_call(ThreadData* thread_data, PyObject* frame);
// A return event: the marker frame returning ends the thread's active hook.
void __tracer_sub_language_dispatch_return(ThreadData* thread_data, PyObject* frame);
// The stepping command in force, as the hook sees it: -1 none (running freely or no command
// that concerns the hook), 0 step into, 1 stepping over a key frame, 2 stepping out.
int __tracer_sub_language_get_action(ThreadData* thread_data);
// 1 when the active hook wants a stop at key frame `frame` (or a breakpoint is hit there).
int __tracer_sub_language_stop_here(ThreadData* thread_data, PyObject* frame, int event);
// Non-zero when `frame` belongs to the active hook's implementation files, -1 after a failed
// lookup (error set), 0 otherwise.
int __tracer_sub_language_in_impl(ThreadData* thread_data, PyObject* frame);
// 1 for a key frame of the thread's active hook, 0 for a hidden implementation frame, -1 for
// any other frame (and whenever the thread has no active hook).
int __tracer_sub_language_get_frame_category(ThreadData* thread_data, PyObject* frame);
// The frame a step-out from `frame` stops in, as the active hook says (new reference), or
// null with the hook's error set.
PyObject* __tracer_sub_language_step_out_frame(ThreadData* thread_data, PyObject* frame);

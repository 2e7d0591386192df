// sublang.h: state of the registered sub-language hooks (template languages and the like
// whose frames the debugger translates, hides or stops in).
#pragma once

#include <Python.h>

#include "support/hashtable.h"
#include "support/ref.h"

struct SubLanguageState {
  int active = 0;           // 1 once any hook is registered
  Ref hooks;                // owned list of registered hook objects, or null
  Ref module_paths;         // owned dict, or null
  Ref marker_frames;        // owned dict, or null
  Ref frame_categories;     // owned dict, or null
  CU_HashTable code_table;  // one-word keys
};

void __tracer_init_sub_language_state(SubLanguageState* state);

struct ThreadData;

// 1 when `frame` is a key frame of the thread's active sub-language, 0 for one of its hidden
// implementation frames, -1 for any other frame (always -1 while the thread has no active
// hook). The implementation-frame test joins with the hooks' frame lists.
int __tracer_sub_language_get_frame_category(ThreadData* thread_data, PyObject* frame);

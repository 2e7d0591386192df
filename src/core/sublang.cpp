// sublang.cpp: sub-language hook state (see sublang.h).
#include "core/sublang.h"

#include "core/tracercore.h"
#include "support/pycompat.h"
#include "threads/threadops.h"

void __tracer_init_sub_language_state(SubLanguageState* state) {
  state->active = 0;
  state->hooks.reset();
  state->module_paths.reset();
  state->marker_frames.reset();
  state->frame_categories.reset();
  if (state->code_table.buckets != nullptr) CU_DeleteHashTable(&state->code_table);
  CU_InitHashTable(&state->code_table, sizeof(void*));
}

int __tracer_sub_language_get_frame_category(ThreadData* thread_data, PyObject* frame) {
  if (thread_data == nullptr || !thread_data->sub_language_hook || !compat::is_plain_frame(frame)) {
    return -1;
  }
  Ref code = Ref::steal(
      reinterpret_cast<PyObject*>(PyFrame_GetCode(reinterpret_cast<PyFrameObject*>(frame))));
  const PyObject* key = code.get();
  return CU_FindHashEntry(&gSelf.sub_language.code_table, &key) != nullptr ? 1 : -1;
}

// sublang.cpp: sub-language hook state (see sublang.h).
#include "core/sublang.h"

void __tracer_init_sub_language_state(SubLanguageState* state) {
  state->active = 0;
  state->hooks.reset();
  state->module_paths.reset();
  state->marker_frames.reset();
  state->frame_categories.reset();
  if (state->code_table.buckets != nullptr) CU_DeleteHashTable(&state->code_table);
  CU_InitHashTable(&state->code_table, sizeof(void*));
}

// breakhere.cpp: whether a line event hits a breakpoint, and the breakpoints' counters.
//
// The common line event, with no breakpoint on its line number, costs one integer lookup:
// the frame's file is worked out only for lines that have breakpoints. Conditions are Python
// code and may do anything, even clear breakpoints or reset the core: the walk over a line's
// chain never touches a record after a condition ran if any record was freed meanwhile.
#include "bp/breakhere.h"

#include <cstdint>
#include <cstring>

#include "core/dispatch.h"
#include "core/sublang.h"
#include "core/tracercore.h"
#include "names/conames.h"
#include "support/dbgcommon.h"
#include "support/dprintf.h"
#include "support/pycompat.h"

namespace {

// Where a line event stands: the code file (null until worked out) and the line.
struct LineEvent {
  ThreadData* thread;
  PyObject* frame;
  int event;
  const char* code_file = nullptr;
  const char* module_file = nullptr;        // the code file's canonical module file, or null
  uint64_t module_generation = UINT64_MAX;  // of the loaded-module table when it was found
  int lineno = 0;
  bool sub_language = false;
  Ref translated;  // keeps a sub-language frame's file text alive
};

// A sub-language key frame: its hook says whether the line may stop and where it really is.
// False when the hook declines or fails (its error is dropped: the program never sees it).
bool translate_sub_language_frame(LineEvent& at) {
  PyObject* hook = at.thread->sub_language_hook.get();
  compat::PendingError saved;
  saved.fetch();
  Ref stop = Ref::steal(PyObject_CallMethod(hook, "_StopHere", "Oii", at.frame, at.event, 1));
  int wanted = stop ? PyObject_IsTrue(stop.get()) : -1;
  if (wanted > 0) {
    at.translated = Ref::steal(PyObject_CallMethod(hook, "_TranslateFrame", "Oi", at.frame, 0));
  }
  PyObject* t = at.translated.get();
  bool usable = t != nullptr && PyTuple_Check(t) && PyTuple_GET_SIZE(t) >= 2 &&
                PyUnicode_Check(PyTuple_GET_ITEM(t, 0)) && PyLong_Check(PyTuple_GET_ITEM(t, 1));
  if (usable) {
    at.code_file = _pystring_to_c_string(PyTuple_GET_ITEM(t, 0));
    long line = PyLong_AsLong(PyTuple_GET_ITEM(t, 1));
    usable = at.code_file != nullptr && line >= INT32_MIN && line <= INT32_MAX &&
             !(line == -1 && PyErr_Occurred() != nullptr);
    at.lineno = static_cast<int>(line);
  }
  saved.restore();
  at.sub_language = true;
  return wanted > 0 && usable;
}

// The code file's canonical module file. The answer for the file met last is kept while
// the loaded-module table does not change (conditions run Python code, which may import and
// register modules, or replace the stored name that an earlier answer points to). While
// file-name diagnostics are written it is looked up each time, so that they show every step.
const char* module_file_of(BpOpsData* data, LineEvent& at) {
  if (dprintf_wanted(kDbgBpFiles)) return __tracer_find_module(data, at.code_file);
  if (at.module_generation == data->modules_generation) return at.module_file;
  bool same_file = at.code_file != nullptr && data->resolved_code_file == at.code_file;
  if (same_file && data->resolved_generation == data->modules_generation) {
    at.module_file = data->resolved_module_file;
  } else {
    at.module_file = __tracer_find_module(data, at.code_file);
    if (at.code_file != nullptr) data->resolved_code_file = at.code_file;
    data->resolved_module_file = at.module_file;
    data->resolved_generation = data->modules_generation;
  }
  at.module_generation = data->modules_generation;
  return at.module_file;
}

// The frame's full file name, which also registers its module so that breakpoints waiting
// for that file learn it. A file whose module is known already (the one met last, the table
// unchanged since) has nothing to register. The program's pending exception is kept.
void find_code_file(BpOpsData* data, LineEvent& at) {
  compat::PendingError saved;
  saved.fetch();
  at.code_file = __tracer_get_full_path(data->co_pathname_table, at.frame);
  bool known = !dprintf_wanted(kDbgBpFiles) && at.code_file != nullptr &&
               data->resolved_generation == data->modules_generation &&
               data->resolved_module_file != nullptr && data->resolved_code_file == at.code_file;
  if (!known) {
    do_dprintf(kDbgBpFiles, "CODE FILE %s\n", dprint_check_str(at.code_file));
    __tracer_resolve_bp_filenames(data, at.code_file);
  }
  saved.restore();
}

bool files_match(BpOpsData* data, LineEvent& at, const Breakpoint* bp) {
  if (at.sub_language) {
    do_dprintf(kDbgBpFiles, "sub_language bp codefile = %s, bp->user_filename = %s\n",
               dprint_check_str(at.code_file), dprint_check_str(bp->user_filename));
    return at.code_file != nullptr && strcmp(at.code_file, bp->user_filename) == 0;
  }
  // A breakpoint whose file no loaded module has matched yet never matches a frame.
  if (bp->module_filename == nullptr) return false;
  const char* modfile = module_file_of(data, at);
  do_dprintf(kDbgBpFiles, "modfile = %s, bp->module_filename = %s\n", dprint_check_str(modfile),
             dprint_check_str(bp->module_filename));
  return modfile != nullptr && strcmp(modfile, bp->module_filename) == 0;
}

// The record's compiled condition, made at its first evaluation. The caller holds its own
// reference: the condition's code may change the text or free the record.
std::shared_ptr<const CompiledCondition> compiled_condition(Breakpoint* bp) {
  if (!bp->compiled) bp->compiled = condition_compile(bp->cond);
  return bp->compiled;
}

// Evaluates a condition in the frame's namespace: 1 true, 0 false, -1 when it cannot be
// evaluated (a broken condition stops). Nothing it raises reaches the program.
int evaluate_condition(const LineEvent& at, Breakpoint* bp) {
  compat::PendingError saved;
  saved.fetch();
  int truth = -1;
  if (at.sub_language) {
    Ref text = Ref::steal(gPtrTo_PyUnicode_FromString(bp->cond));
    Ref result;
    if (text) {
      result = Ref::steal(PyObject_CallMethod(at.thread->sub_language_hook.get(), "_Eval", "OO",
                                              text.get(), at.frame));
    }
    truth = result ? PyObject_IsTrue(result.get()) : -1;
  } else {
    std::shared_ptr<const CompiledCondition> condition = compiled_condition(bp);
    truth = condition_evaluate(*condition, reinterpret_cast<PyFrameObject*>(at.frame));
  }
  saved.restore();  // also drops whatever the condition raised
  return truth < 0 ? -1 : truth;
}

// An ignored or temporary hit, once the breakpoint is to stop: true when it really stops.
bool take_hit(BpOpsData* data, Breakpoint* bp, int count) {
  if (bp->ignore_count > 0 && count) {
    --bp->ignore_count;
    __tracer_add_changed_bp(data, bp);
    return false;
  }
  if (bp->temporary && count) {
    bp->deleted = 1;
    __tracer_add_changed_bp(data, bp);
    // Out of the table at once: a deleted record lives on the changed list only, whose
    // reader frees it.
    __tracer_del_userbp(data, bp);
  }
  return true;
}

}  // namespace

int __tracer_break_here(BpOpsData* data, int event, ThreadData* thread, PyObject* frame,
                        int count) {
  // No breakpoint anywhere: nothing to find, whatever the frame (the common line event).
  if (data->bp_table.num_entries == 0 || !compat::is_plain_frame(frame)) return 0;
  LineEvent at{thread, frame, event, nullptr, nullptr, UINT64_MAX, 0, false, Ref()};
  // Only a thread inside a sub-language has key frames (an inline test before the call).
  if (thread != nullptr && thread->sub_language_hook &&
      __tracer_sub_language_get_frame_category(thread, frame) == 1) {
    enter_debugger();  // the hook is Python code
    if (!translate_sub_language_frame(at)) return 0;
  } else {
    at.lineno = frame == data->line_hint_frame
                    ? data->line_hint
                    : PyFrame_GetLineNumber(reinterpret_cast<PyFrameObject*>(frame));
  }
  Breakpoint* bp = __tracer_bps_at_line(data, at.lineno);
  if (bp == nullptr) return 0;
  do_dprintf(kDbgBpFiles, "Found bp table entry for lineno %d\n", at.lineno);
  // From here on Python code may run (file names, conditions): this thread enters.
  enter_debugger();
  if (!at.sub_language) find_code_file(data, at);
  bool stop = false;
  for (Breakpoint* next = nullptr; bp != nullptr; bp = next) {
    next = bp->next_at_line;
    int match = files_match(data, at, bp) ? 1 : 0;
    do_dprintf(kDbgBpFiles, "files_match = %d\n", match);
    if (!match || !bp->enabled) continue;
    if (count) {
      // Every pass over an enabled breakpoint's line counts, whatever its condition says.
      ++bp->hit_count;
      __tracer_add_changed_bp(data, bp);
    }
    if (bp->cond == nullptr) {
      stop = take_hit(data, bp, count) || stop;
      continue;
    }
    uint64_t frees = data->free_count;
    int truth = evaluate_condition(at, bp);
    // The condition freed breakpoints (cleared them, or reset the core): neither this record
    // nor the rest of the chain may be touched any more.
    if (frees != data->free_count) return stop || truth != 0 ? 1 : 0;
    if (truth < 0) {
      stop = true;  // a broken condition stops, counters untouched
    } else if (truth > 0) {
      stop = take_hit(data, bp, count) || stop;
    }
  }
  return stop ? 1 : 0;
}

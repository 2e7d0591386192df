// bpops.h: breakpoint records, their table, the changed-breakpoint list, and the table of
// loaded module files that breakpoints are matched against.
//
// The breakpoint table is keyed by line number alone: a line event that finds no entry for
// its line costs one integer lookup and nothing else. Each entry holds the chain of every
// breakpoint on that line, of every file, newest first. Which file a breakpoint means is
// settled by the loaded-module table (bpfiles.cpp): the user's spelling of a file name is
// mapped to the canonical name of a loaded module's file, by file identity, never by text.
#pragma once

#include <Python.h>

#include <cstdint>
#include <memory>
#include <string>

#include "bp/condition.h"
#include "names/fileops.h"
#include "support/hashtable.h"
#include "support/ref.h"

struct COPathnameTable;

struct Breakpoint {
  int32_t id;                // unique, never reused within a session
  char* user_filename;       // owned: the name as given to set_break; never null
  char* module_filename;     // owned or null: canonical file once resolved
  int32_t lineno;            // also the key of the breakpoint table
  int16_t enabled;           // low 16 bits of what the user gave
  int16_t temporary;         // deleted when it fires
  char* cond;                // owned UTF-8 text, or null for no condition
  int32_t ignore_count;      // further hits to ignore
  int32_t hit_count;         // hits so far
  int32_t deleted;           // fired as temporary; waits on the changed list
  int32_t on_changed_list;   // 1 while on the changed list
  Breakpoint* next_at_line;  // chain of the same line number
  Breakpoint* next_changed;  // changed list
  // The condition compiled, made at its first evaluation and dropped when the text changes;
  // shared so that an evaluation keeps it while the condition's code frees the record.
  std::shared_ptr<const CompiledCondition> compiled;
};

struct BpOpsData {
  CU_HashTable bp_table{};             // 4-byte line number -> head of the line's chain
  Breakpoint* changed_head = nullptr;  // most recently changed first
  int32_t next_id = 1;
  CU_HashTable loaded_modules{};    // file name -> malloc'ed canonical module file name
  FileOpsData* file_ops = nullptr;  // borrowed from the code-object table
  COPathnameTable* co_pathname_table = nullptr;  // borrowed: frames to full file names
  // Module files registered as new; reported by stop_trace, kept across resets.
  int unique_import_count = 0;
  char module_name_buffer[kMaxPathLen + 1] = {};
  Ref file_key;  // owned: the str "__file__"
  // Counts every record freed, for the life of the process: code that runs Python code in
  // the middle of a walk over records (conditions) tells from it whether they still exist.
  uint64_t free_count = 0;
  // Counts every change of the loaded-module table (a name stored or replaced, the table
  // emptied), for the life of the process: a canonical name found earlier is still the
  // answer, and still allocated, while it has not moved.
  uint64_t modules_generation = 0;
  // The last code file a line with breakpoints was met in, and its canonical module file
  // (borrowed from the loaded-module table) as of `resolved_generation`. A hot line asks the
  // same question at every pass.
  std::string resolved_code_file;
  // The line of the line event being delivered, when its source reported it (sys.monitoring
  // does), for `line_hint_frame` only (borrowed, and set only while that event is
  // delivered): the hit test then need not work the line out from the frame again.
  PyObject* line_hint_frame = nullptr;
  int line_hint = 0;
  const char* resolved_module_file = nullptr;  // null when no module has that file
  uint64_t resolved_generation = UINT64_MAX;
};

void __tracer_init_bp_ops_data(BpOpsData* data, COPathnameTable* co_pathname_table);
void __tracer_clear_bp_ops_data(BpOpsData* data, COPathnameTable* co_pathname_table);

// ---- Records ------------------------------------------------------------------------------

// New record, or null (no error set) when memory or the condition's conversion fails; the id
// is used up either way. `cond` is None for no condition.
Breakpoint* __tracer_create_bp(BpOpsData* data, const char* file, int lineno, int enabled,
                               int temporary, PyObject* cond, int ignore_count);
void __tracer_free_bp(Breakpoint* bp);
int __tracer_add_userbp(BpOpsData* data, Breakpoint* bp);
void __tracer_del_userbp(BpOpsData* data, Breakpoint* bp);
// The chain of breakpoints on `lineno`, newest first, or null.
Breakpoint* __tracer_bps_at_line(BpOpsData* data, int32_t lineno);

// Marks the line event of `frame` at `line` as being delivered, for the life of the mark.
// Another thread's event may replace the mark meanwhile (the interpreter lock is given up
// while a thread waits): a mark is only ever cleared by its own event, and a replaced one is
// simply missing, so the hit test never reads another event's line.
class LineHint {
 public:
  LineHint(BpOpsData* data, PyObject* frame, int line) : data_(data), frame_(frame), line_(line) {
    data_->line_hint_frame = frame;
    data_->line_hint = line;
  }
  ~LineHint() {
    if (data_->line_hint_frame == frame_ && data_->line_hint == line_) {
      data_->line_hint_frame = nullptr;
    }
  }
  LineHint(const LineHint&) = delete;
  LineHint& operator=(const LineHint&) = delete;

 private:
  BpOpsData* data_;
  PyObject* frame_;
  int line_;
};

// ---- The changed list -----------------------------------------------------------------------

void __tracer_add_changed_bp(BpOpsData* data, Breakpoint* bp);
void __tracer_remove_bp_from_changed(BpOpsData* data, Breakpoint* bp);
void __tracer_clear_changed_bps(BpOpsData* data);
// New 8-tuple describing `bp`; null with MemoryError set.
PyObject* __tracer_python_bp_data(const Breakpoint* bp);
// New 2-tuple (ids of deleted breakpoints, tuples of the other changed breakpoints); the
// changed list is emptied. Null with MemoryError set when it cannot be made (the list is
// then left as it was).
PyObject* __tracer_get_changed_bps_lists(BpOpsData* data);

// ---- The user's operations ----------------------------------------------------------------

// The new id, or -1 with MemoryError set.
int __tracer_set_break(BpOpsData* data, const char* file, int lineno, int enabled, int temporary,
                       PyObject* cond, int ignore_count);
void __tracer_clear_breaks(BpOpsData* data, const char* file, int lineno);
int __tracer_enable_breaks(BpOpsData* data, const char* file, int lineno, int flag);
int __tracer_ignore_breaks(BpOpsData* data, const char* file, int lineno, int count);
// -1 with MemoryError set when the new condition cannot be stored.
int __tracer_set_breaks_cond(BpOpsData* data, const char* file, int lineno, PyObject* cond);
void __tracer_clear_all_breaks(BpOpsData* data);
// New lists, or null with MemoryError set.
PyObject* __tracer_get_breaks(BpOpsData* data, const char* file, int lineno);
PyObject* __tracer_get_file_breaks(BpOpsData* data, const char* file);

// ---- Loaded module files (bpfiles.cpp) ------------------------------------------------------

// The canonical name now stored for `name` when it is the same file as `module_file`, else
// null.
const char* add_to_loaded_modules_if_samefile(BpOpsData* data, const char* name,
                                              const char* module_file);
// The canonical module file that `name` stands for, or null; a name found by file identity
// is remembered as a further synonym.
const char* __tracer_find_module(BpOpsData* data, const char* name);
void __tracer_clear_loaded_modules(BpOpsData* data);
// Gives a new breakpoint its module file when that is loaded. 0 with MemoryError set.
int __tracer_find_bp_filename_synonyms(BpOpsData* data, Breakpoint* bp);
// Registers a module file and gives waiting breakpoints their module file.
void __tracer_resolve_bp_filenames(BpOpsData* data, const char* module_file);
// The same for a module object, through its __file__.
void __tracer_xfer_module_bps(BpOpsData* data, PyObject* module);

// opcodes.h: the running interpreter's byte-code vocabulary, read once when the module loads,
// and the two decoders that every reading of co_code needs: instructions and the exception
// table.
//
// Opcode numbers, inline-cache sizes and operand encodings change from one interpreter to the
// next (3.13 renumbered nearly everything, 3.14 and 3.15 added opcodes and caches). Nothing
// here is compiled in: the numbers come from the interpreter's own `opcode` module, and the
// operand encodings that differ (the flag bit of LOAD_GLOBAL and LOAD_ATTR, the two indexes
// packed into LOAD_FAST_LOAD_FAST) are measured on a probe function compiled at load. If any
// of that fails the table stays "not ready" and every analysis answers "not caught".
#pragma once

#include <Python.h>

#include <cstdint>

#include "support/ref.h"

namespace bytecode {

// The opcodes the analysis reads, by role. An opcode the running interpreter lacks has the
// number kAbsent, which never equals a byte of co_code, so tests against it are simply false.
enum Op : int {
  kCache,
  kExtendedArg,
  kNop,
  kNotTaken,
  kPopTop,
  kPushExcInfo,
  kCheckExcMatch,
  kCheckEgMatch,
  kJumpIfFalse,  // the forward conditional jump that links except clauses
  kJumpIfNone,   // the one that links except* clauses
  kReraise,
  kCopy,
  kSwap,
  kBuildList,
  kBuildTuple,
  kListAppend,
  kLoadConst,
  kLoadSmallInt,
  kLoadCommonConstant,
  kLoadName,
  kLoadGlobal,
  kLoadAttr,
  kLoadFast,
  kLoadFastCheck,
  kLoadFastBorrow,
  kLoadFastLoadFast,
  kLoadFastBorrowLoadFastBorrow,
  kWithExceptStart,
  kEndAsyncFor,
  kCallIntrinsic1,
  kCleanupThrow,
  kForIter,
  kSend,
  kCallFunctionEx,
  kOpCount
};

constexpr int kAbsent = -1;

struct Opcodes {
  bool ready = false;
  int op[kOpCount];
  uint8_t caches[256];  // inline cache units after each opcode
  // co_names index of LOAD_GLOBAL / LOAD_ATTR = oparg >> shift; with a shift of 1, bit 0 is a
  // flag (push NULL for a call; method form) that a class expression never sets.
  int global_name_shift = 0;
  int attr_name_shift = 0;
  // LOAD_FAST_LOAD_FAST (and its borrowing twin): first local = oparg >> pair_shift, second
  // = oparg & pair_mask. pair_shift 0 means the encoding was not confirmed: unknown shape.
  int pair_shift = 0;
  int pair_mask = 0;
  // Operand of CALL_INTRINSIC_1 in the generator and coroutine body wrapper, or kAbsent.
  int intrinsic_stopiteration_error = kAbsent;
  Ref common_constants;  // tuple indexed by LOAD_COMMON_CONSTANT's operand, or null
};

// The table (borrowed, lives for the process).
const Opcodes& opcodes() noexcept;

// Reads the table from the running interpreter. Safe to call more than once; keeps the
// pending exception and leaves no error. Returns 0 when the table is ready, -1 when it is not
// (the analysis then answers "not caught" everywhere).
int init_opcodes() noexcept;

// ---- Instructions -----------------------------------------------------------------------

struct Instr {
  int offset = 0;  // byte offset of the instruction (after its EXTENDED_ARG prefixes)
  int op = 0;
  int arg = 0;   // EXTENDED_ARG prefixes folded in
  int next = 0;  // byte offset of the following instruction, past the inline caches
};

// Decodes the instruction at byte `offset` of `code` (`size` bytes), folding EXTENDED_ARG
// prefixes. False when the offset or the instruction lies outside the code.
bool decode_at(const uint8_t* code, int size, int offset, Instr* out) noexcept;

// The offset of the instruction that `offset` belongs to: callers of 3.11 and 3.12 may report
// an offset inside the inline caches of their call. -1 when it is outside the code.
int instruction_start(const uint8_t* code, int size, int offset) noexcept;

// ---- The exception table ----------------------------------------------------------------

// One entry, in bytes: instructions in [start, end) hand exceptions to `target`.
struct TableEntry {
  int start = 0;
  int end = 0;
  int target = 0;
  int depth = 0;
  bool lasti = false;
};

// The entry of `table` (a code object's co_exceptiontable) covering byte `offset`. False when
// none covers it (or the table is malformed): exceptions there leave the frame.
bool find_handler(PyObject* table, int offset, TableEntry* out) noexcept;

}  // namespace bytecode

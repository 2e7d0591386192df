// opcodes.cpp: reading the interpreter's byte-code vocabulary at load, and decoding co_code
// and co_exceptiontable with it.
#include "exc/opcodes.h"

#include <cstring>

#include "support/dprintf.h"
#include "support/pycompat.h"

namespace bytecode {

namespace {

NoDestructor<Opcodes> gOpcodes;

// Names by role, in the order of enum Op. Where an opcode was renamed between versions the
// alternatives are separated by '|', the first one present wins.
constexpr const char* kOpNames[kOpCount] = {
    "CACHE",
    "EXTENDED_ARG",
    "NOP",
    "NOT_TAKEN",
    "POP_TOP",
    "PUSH_EXC_INFO",
    "CHECK_EXC_MATCH",
    "CHECK_EG_MATCH",
    "POP_JUMP_IF_FALSE|POP_JUMP_FORWARD_IF_FALSE",
    "POP_JUMP_IF_NONE|POP_JUMP_FORWARD_IF_NONE",
    "RERAISE",
    "COPY",
    "SWAP",
    "BUILD_LIST",
    "BUILD_TUPLE",
    "LIST_APPEND",
    "LOAD_CONST",
    "LOAD_SMALL_INT",
    "LOAD_COMMON_CONSTANT",
    "LOAD_NAME",
    "LOAD_GLOBAL",
    "LOAD_ATTR",
    "LOAD_FAST",
    "LOAD_FAST_CHECK",
    "LOAD_FAST_BORROW",
    "LOAD_FAST_LOAD_FAST",
    "LOAD_FAST_BORROW_LOAD_FAST_BORROW",
    "WITH_EXCEPT_START",
    "END_ASYNC_FOR",
    "CALL_INTRINSIC_1",
    "CLEANUP_THROW",
    "FOR_ITER",
    "SEND",
    "CALL_FUNCTION_EX",
};

// Without these the shapes of an except clause cannot be read at all.
constexpr Op kRequired[] = {kCache,       kExtendedArg, kPopTop,    kPushExcInfo, kCheckExcMatch,
                            kJumpIfFalse, kReraise,     kLoadConst, kLoadName,    kLoadGlobal,
                            kLoadAttr,    kLoadFast,    kBuildTuple};

// opmap[name] as an opcode number, or kAbsent (pseudo opcodes, >= 256, never reach co_code).
// opmap is a dict up to 3.14 and a frozendict (no dict subclass) in 3.15: read it as a mapping.
int opcode_number(PyObject* opmap, PyObject* name) {
  Ref value = Ref::steal(PyObject_GetItem(opmap, name));
  if (!value || !PyLong_Check(value.get())) {
    PyErr_Clear();
    return kAbsent;
  }
  long number = PyLong_AsLong(value.get());
  if (number < 0 || number > 255) {
    PyErr_Clear();
    return kAbsent;
  }
  return static_cast<int>(number);
}

int opcode_number(PyObject* opmap, const char* name) {
  Ref key = Ref::steal(PyUnicode_FromString(name));
  if (!key) {
    PyErr_Clear();
    return kAbsent;
  }
  return opcode_number(opmap, key.get());
}

int opcode_by_alternatives(PyObject* opmap, const char* names) {
  char one[64];
  const char* start = names;
  while (*start != '\0') {
    const char* bar = std::strchr(start, '|');
    size_t length = bar != nullptr ? static_cast<size_t>(bar - start) : std::strlen(start);
    if (length >= sizeof(one)) return kAbsent;
    std::memcpy(one, start, length);
    one[length] = '\0';
    int number = opcode_number(opmap, one);
    if (number != kAbsent) return number;
    if (bar == nullptr) break;
    start = bar + 1;
  }
  return kAbsent;
}

// Cache sizes: a list indexed by opcode (3.11, 3.12) or a mapping name -> count holding only
// the non-zero ones (a dict in 3.13 and 3.14, a frozendict in 3.15).
bool read_cache_sizes(PyObject* opcode_module, PyObject* opmap, Opcodes* table) {
  std::memset(table->caches, 0, sizeof(table->caches));
  Ref entries = Ref::steal(PyObject_GetAttrString(opcode_module, "_inline_cache_entries"));
  if (!entries) return false;
  if (PyList_Check(entries.get()) || PyTuple_Check(entries.get())) {
    Ref seq = Ref::steal(PySequence_Tuple(entries.get()));
    if (!seq) return false;
    Py_ssize_t n = PyTuple_GET_SIZE(seq.get());
    for (Py_ssize_t i = 0; i < n && i < 256; ++i) {
      long count = PyLong_AsLong(PyTuple_GET_ITEM(seq.get(), i));
      if (count < 0 || count > 255) return false;
      table->caches[i] = static_cast<uint8_t>(count);
    }
    return !PyErr_Occurred();
  }
  Ref items = Ref::steal(PyMapping_Items(entries.get()));
  if (!items) return false;
  Py_ssize_t n = PyList_GET_SIZE(items.get());
  for (Py_ssize_t i = 0; i < n; ++i) {
    PyObject* pair = PyList_GET_ITEM(items.get(), i);
    if (!PyTuple_Check(pair) || PyTuple_GET_SIZE(pair) != 2) return false;
    PyObject* name = PyTuple_GET_ITEM(pair, 0);
    long count = PyLong_AsLong(PyTuple_GET_ITEM(pair, 1));
    if (count < 0 || count > 255) return false;
    if (!PyUnicode_Check(name)) return false;
    int op = opcode_number(opmap, name);  // kAbsent for specialised or pseudo names
    if (op != kAbsent) table->caches[op] = static_cast<uint8_t>(count);
  }
  return true;
}

// Index of "INTRINSIC_STOPITERATION_ERROR" in opcode._intrinsic_1_descs (3.12+); 3.11 has no
// body wrapper for generators.
int stopiteration_intrinsic(PyObject* opcode_module) {
  Ref descs = Ref::steal(PyObject_GetAttrString(opcode_module, "_intrinsic_1_descs"));
  if (!descs) {
    PyErr_Clear();
    return kAbsent;
  }
  Ref seq = Ref::steal(PySequence_Tuple(descs.get()));
  if (!seq) {
    PyErr_Clear();
    return kAbsent;
  }
  for (Py_ssize_t i = 0; i < PyTuple_GET_SIZE(seq.get()); ++i) {
    PyObject* name = PyTuple_GET_ITEM(seq.get(), i);
    if (PyUnicode_Check(name) &&
        PyUnicode_CompareWithASCIIString(name, "INTRINSIC_STOPITERATION_ERROR") == 0)
      return static_cast<int>(i);
  }
  return kAbsent;
}

// The operand encodings that changed between versions, measured on the byte code of a probe
// function instead of being assumed per version. Its names and locals are chosen so that
// every index is non-zero: g1 is co_names[1], at is co_names[2], a and b are locals 1 and 2.
constexpr const char* kProbeSource =
    "def probe(z, a, b):\n"
    "    return (g0, g1.at, (a, b))\n";

bool calibrate_operands(Opcodes* table) {
  Ref module_code = Ref::steal(Py_CompileString(kProbeSource, "<operand probe>", Py_file_input));
  if (!module_code) return false;
  PyObject* consts = reinterpret_cast<PyCodeObject*>(module_code.get())->co_consts;
  PyObject* probe = nullptr;
  for (Py_ssize_t i = 0; i < PyTuple_GET_SIZE(consts); ++i) {
    if (PyCode_Check(PyTuple_GET_ITEM(consts, i))) probe = PyTuple_GET_ITEM(consts, i);
  }
  if (probe == nullptr) return false;
  Ref bytes = Ref::steal(PyCode_GetCode(reinterpret_cast<PyCodeObject*>(probe)));
  if (!bytes || !PyBytes_Check(bytes.get())) return false;
  const auto* code = reinterpret_cast<const uint8_t*>(PyBytes_AS_STRING(bytes.get()));
  int size = static_cast<int>(PyBytes_GET_SIZE(bytes.get()));

  bool saw_global = false, saw_attr = false, saw_locals = false;
  Instr ins;
  // Walking the whole function from 0 also checks the cache sizes: every step must land on
  // an instruction and the walk must end exactly at the end of the code.
  int offset = 0;
  while (offset < size) {
    if (!decode_at(code, size, offset, &ins)) return false;
    if (ins.op == table->op[kLoadGlobal] && !saw_global) {
      // g0 first (index 0, tells nothing), then g1 (index 1).
      if (ins.arg == 2) {
        table->global_name_shift = 1;
        saw_global = true;
      } else if (ins.arg == 1) {
        table->global_name_shift = 0;
        saw_global = true;
      } else if (ins.arg != 0) {
        return false;
      }
    } else if (ins.op == table->op[kLoadAttr]) {
      if (ins.arg == 4)
        table->attr_name_shift = 1;
      else if (ins.arg == 2)
        table->attr_name_shift = 0;
      else
        return false;
      saw_attr = true;
    } else if (ins.op == table->op[kLoadFastLoadFast] ||
               ins.op == table->op[kLoadFastBorrowLoadFastBorrow]) {
      if (ins.arg == ((1 << 4) | 2)) {
        table->pair_shift = 4;
        table->pair_mask = 15;
      }
      saw_locals = true;
    } else if (ins.op == table->op[kLoadFast] || ins.op == table->op[kLoadFastBorrow]) {
      saw_locals = true;
    }
    offset = ins.next;
  }
  return offset == size && saw_global && saw_attr && saw_locals;
}

bool load_table(Opcodes* table) {
  Ref opcode_module = Ref::steal(PyImport_ImportModule("opcode"));
  if (!opcode_module) return false;
  Ref opmap = Ref::steal(PyObject_GetAttrString(opcode_module.get(), "opmap"));
  if (!opmap || !PyMapping_Check(opmap.get())) return false;
  for (int role = 0; role < kOpCount; ++role) {
    table->op[role] = opcode_by_alternatives(opmap.get(), kOpNames[role]);
  }
  for (Op role : kRequired) {
    if (table->op[role] == kAbsent) return false;
  }
  // CACHE must be 0 for the step back over cache units; it is in every version we know.
  if (table->op[kCache] != 0) return false;
  if (!read_cache_sizes(opcode_module.get(), opmap.get(), table)) return false;
  table->intrinsic_stopiteration_error = stopiteration_intrinsic(opcode_module.get());
  Ref common = Ref::steal(PyObject_GetAttrString(opcode_module.get(), "_common_constants"));
  if (common) {
    table->common_constants = Ref::steal(PySequence_Tuple(common.get()));
    if (!table->common_constants) return false;
  }
  PyErr_Clear();
  return calibrate_operands(table);
}

}  // namespace

const Opcodes& opcodes() noexcept {
  return gOpcodes.get();
}

int init_opcodes() noexcept {
  Opcodes& table = gOpcodes.get();
  if (table.ready) return 0;
  compat::PendingError saved;
  saved.fetch();
  // Decoding during the probe needs the numbers, so they are filled in place; `ready` is set
  // only once everything is confirmed.
  bool ok = load_table(&table);
  if (!ok) {
    do_dprintf(kDbgExceptions, "Handler analysis disabled: byte-code tables unreadable\n");
    table.common_constants.reset();
  }
  PyErr_Clear();
  saved.restore();
  table.ready = ok;
  return ok ? 0 : -1;
}

bool decode_at(const uint8_t* code, int size, int offset, Instr* out) noexcept {
  const Opcodes& table = gOpcodes.get();
  if (offset < 0 || offset + 1 >= size) return false;
  int arg = 0;
  int pos = offset;
  int op = code[pos];
  // EXTENDED_ARG carries no caches; at most three prefixes are needed for a 32-bit operand,
  // more would be malformed.
  for (int prefixes = 0; op == table.op[kExtendedArg]; ++prefixes) {
    if (prefixes == 3) return false;
    arg = (arg << 8) | code[pos + 1];
    pos += 2;
    if (pos + 1 >= size) return false;
    op = code[pos];
  }
  arg = (arg << 8) | code[pos + 1];
  out->offset = pos;
  out->op = op;
  out->arg = arg;
  out->next = pos + 2 * (1 + table.caches[op]);
  do_dprintf(kDbgExceptions, "Returning opcode of %d\n", op);
  return out->next <= size;
}

int instruction_start(const uint8_t* code, int size, int offset) noexcept {
  if (offset < 0 || offset + 1 >= size) return -1;
  offset &= ~1;
  // A cache unit is CACHE 0 (opcode 0, operand 0); no real instruction has opcode 0.
  while (offset > 0 && code[offset] == 0 && code[offset + 1] == 0) offset -= 2;
  return offset;
}

namespace {

// One 6-bit-group varint of the exception table, most significant group first; 0x40 marks a
// continuation, 0x80 marks the first byte of an entry (skipped here).
bool read_varint(const uint8_t*& p, const uint8_t* end, int* value) {
  if (p >= end) return false;
  unsigned int byte = *p++;
  unsigned int result = byte & 63;
  while (byte & 64) {
    if (p >= end || result > (1u << 24)) return false;
    byte = *p++;
    result = (result << 6) | (byte & 63);
  }
  *value = static_cast<int>(result);
  return true;
}

}  // namespace

bool find_handler(PyObject* table, int offset, TableEntry* out) noexcept {
  if (table == nullptr || !PyBytes_Check(table) || offset < 0) return false;
  const auto* p = reinterpret_cast<const uint8_t*>(PyBytes_AS_STRING(table));
  const uint8_t* end = p + PyBytes_GET_SIZE(table);
  int unit = offset / 2;
  // Entries are sorted by start and never overlap; a linear scan stops at the first entry
  // that starts past the offset.
  while (p < end) {
    int start, length, target, depth_lasti;
    if ((*p & 0x80) == 0) return false;
    if (!read_varint(p, end, &start) || !read_varint(p, end, &length) ||
        !read_varint(p, end, &target) || !read_varint(p, end, &depth_lasti))
      return false;
    if (start > unit) return false;
    if (unit < start + length) {
      out->start = 2 * start;
      out->end = 2 * (start + length);
      out->target = 2 * target;
      out->depth = depth_lasti >> 1;
      out->lasti = (depth_lasti & 1) != 0;
      return true;
    }
  }
  return false;
}

}  // namespace bytecode

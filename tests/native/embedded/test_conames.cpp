// test_conames.cpp: the code-object pathname table: registration (first name kept, forced
// replacement and pinning, nested code objects), lookup, the periodic sweep of code objects
// that only the table holds, the walk over a module's functions and classes, and the
// references the table takes and gives back.
#include "names/conames.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <vector>

#include "test_support.h"

namespace {

using testsupport::compile;
using testsupport::DebugCapture;
using testsupport::function_code;
using testsupport::item;
using testsupport::new_globals;
using testsupport::run_in;

using ConamesTest = testsupport::TableTest;

// Every code object in the constants of `code`, at any depth, not counting `code` itself.
void collect_nested(PyObject* code, std::vector<PyObject*>* found) {
  PyObject* consts = reinterpret_cast<PyCodeObject*>(code)->co_consts;
  for (Py_ssize_t i = 0; i < PyTuple_GET_SIZE(consts); ++i) {
    PyObject* item = PyTuple_GET_ITEM(consts, i);
    if (!PyCode_Check(item)) continue;
    found->push_back(item);
    collect_nested(item, found);
  }
}

// A code object that nothing else refers to. New reference.
Ref lone_code(const std::string& name) {
  Ref code = Ref::steal(reinterpret_cast<PyObject*>(PyCode_NewEmpty("lone.py", name.c_str(), 1)));
  EXPECT_TRUE(code);
  return code;
}

std::string lookup(COPathnameTable* table, PyObject* code) {
  const char* path = LookupCOPathname(table, code);
  return path != nullptr ? path : "(none)";
}

// Source of classes C1 to C<depth>, each nested in the one before and each with a method m.
std::string nested_classes(int depth) {
  std::string source;
  for (int level = 1; level <= depth; ++level) {
    const std::string indent(4 * (level - 1), ' ');
    source += indent + "class C" + std::to_string(level) + ":\n";
    source += indent + "    def m(self): pass\n";
  }
  return source;
}

TEST_F(ConamesTest, InitMakesAnEmptyTable) {
  EXPECT_FALSE(table()->dict);
  EXPECT_EQ(table()->sweep_counter, 0);
  EXPECT_EQ(table()->file_ops, file_ops());
  EXPECT_STREQ(table()->path_buffer, "");
  ASSERT_TRUE(table()->file_key);
  EXPECT_STREQ(PyUnicode_AsUTF8(table()->file_key.get()), "__file__");
}

TEST_F(ConamesTest, CreateEntryPairsBytesWithObject) {
  Ref marker = Ref::steal(PyList_New(0));
  const Py_ssize_t before = Py_REFCNT(marker.get());
  Ref entry = Ref::steal(CreateEntry("/p/m.py", marker.get()));
  ASSERT_TRUE(entry);
  ASSERT_TRUE(PyTuple_CheckExact(entry.get()));
  ASSERT_EQ(PyTuple_GET_SIZE(entry.get()), 2);
  EXPECT_STREQ(PyBytes_AsString(PyTuple_GET_ITEM(entry.get(), 0)), "/p/m.py");
  EXPECT_EQ(PyTuple_GET_ITEM(entry.get(), 1), marker.get());
  EXPECT_EQ(Py_REFCNT(marker.get()), before + 1);
}

TEST_F(ConamesTest, CreateEntryWithoutPathnameFails) {
  EXPECT_EQ(CreateEntry(nullptr, Py_None), nullptr);
  EXPECT_NE(PyErr_Occurred(), nullptr);
  PyErr_Clear();
}

TEST_F(ConamesTest, EntryHoldsPathBytesAndNone) {
  Ref code = compile("x = 1\n", "m.py");
  ASSERT_EQ(RegisterCOPathname(table(), code.get(), "/p/m.py", nullptr, 0), 0);
  Ref key = Ref::steal(PyLong_FromVoidPtr(code.get()));
  PyObject* entry = PyDict_GetItem(table()->dict.get(), key.get());
  ASSERT_NE(entry, nullptr);
  ASSERT_TRUE(PyTuple_Check(entry));
  EXPECT_STREQ(PyBytes_AsString(PyTuple_GET_ITEM(entry, 0)), "/p/m.py");
  EXPECT_EQ(PyTuple_GET_ITEM(entry, 1), Py_None);
  // The lookup hands out the text of that very bytes object.
  EXPECT_EQ(LookupCOPathname(table(), code.get()), PyBytes_AsString(PyTuple_GET_ITEM(entry, 0)));
}

TEST_F(ConamesTest, LookupOfUnknownCodeIsNullWithoutError) {
  Ref code = compile("x = 1\n", "m.py");
  EXPECT_EQ(LookupCOPathname(table(), code.get()), nullptr);  // no dict yet
  Ref other = compile("y = 2\n", "n.py");
  ASSERT_EQ(RegisterCOPathname(table(), other.get(), "/p/n.py", nullptr, 0), 0);
  EXPECT_EQ(LookupCOPathname(table(), code.get()), nullptr);
  EXPECT_EQ(LookupCOPathname(table(), nullptr), nullptr);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

TEST_F(ConamesTest, NullCodeIsNotRegistered) {
  EXPECT_EQ(RegisterCOPathname(table(), nullptr, "/p/m.py", nullptr, 0), -1);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

TEST_F(ConamesTest, RegisteringTwiceWithoutForceKeepsFirstName) {
  Ref code = compile("x = 1\n", "m.py");
  const Py_ssize_t before = Py_REFCNT(code.get());
  EXPECT_EQ(RegisterCOPathname(table(), code.get(), "/first/m.py", nullptr, 0), 0);
  EXPECT_EQ(Py_REFCNT(code.get()), before + 1);
  EXPECT_EQ(RegisterCOPathname(table(), code.get(), "/second/m.py", Py_None, 0), 0);
  EXPECT_EQ(lookup(table(), code.get()), "/first/m.py");
  EXPECT_EQ(Py_REFCNT(code.get()), before + 1);
  EXPECT_EQ(entry_count(), 1);
}

TEST_F(ConamesTest, ForceReplacesNameAndPinsTheCode) {
  Ref code = lone_code("pinned");
  PyObject* pinned = code.get();
  const Py_ssize_t before = Py_REFCNT(pinned);
  ASSERT_EQ(RegisterCOPathname(table(), pinned, "/first/m.py", nullptr, 0), 0);
  ASSERT_EQ(RegisterCOPathname(table(), pinned, "/second/m.py", nullptr, 1), 0);
  EXPECT_EQ(lookup(table(), pinned), "/second/m.py");
  EXPECT_EQ(Py_REFCNT(pinned), before + 2);
  code.reset();  // now held by the table alone, twice
  run_sweep();
  run_sweep();
  EXPECT_EQ(entry_count(), 1);
  EXPECT_EQ(lookup(table(), pinned), "/second/m.py");
  // Give back the pin so that the table's clearing frees the code object.
  Py_DECREF(pinned);
}

TEST_F(ConamesTest, ForceOnNewCodeTakesOneReference) {
  Ref code = compile("x = 1\n", "m.py");
  const Py_ssize_t before = Py_REFCNT(code.get());
  ASSERT_EQ(RegisterCOPathname(table(), code.get(), "/p/m.py", nullptr, 1), 0);
  EXPECT_EQ(Py_REFCNT(code.get()), before + 1);
}

TEST_F(ConamesTest, CodeHeldOnlyByTableLeavesAtNextSweep) {
  Ref code = lone_code("victim");
  const auto address = reinterpret_cast<uintptr_t>(code.get());
  ASSERT_EQ(RegisterCOPathname(table(), code.get(), "/old/victim.py", nullptr, 0), 0);
  code.reset();
  EXPECT_EQ(entry_count(), 1);
  run_sweep();
  EXPECT_EQ(entry_count(), 0);
  Ref old_key = Ref::steal(PyLong_FromVoidPtr(reinterpret_cast<void*>(address)));
  EXPECT_EQ(PyDict_Contains(table()->dict.get(), old_key.get()), 0);
  // The allocator hands the freed block to the next code object of the same size.
  Ref successor = lone_code("victim");
  ASSERT_EQ(reinterpret_cast<uintptr_t>(successor.get()), address)
      << "the new code object did not reuse the freed address";
  EXPECT_EQ(LookupCOPathname(table(), successor.get()), nullptr);
  ASSERT_EQ(RegisterCOPathname(table(), successor.get(), "/new/victim.py", nullptr, 0), 0);
  EXPECT_EQ(lookup(table(), successor.get()), "/new/victim.py");
}

TEST_F(ConamesTest, SweepRunsOnEvery5000thCallOnly) {
  Ref code = lone_code("victim");
  ASSERT_EQ(RegisterCOPathname(table(), code.get(), "/v.py", nullptr, 0), 0);
  ASSERT_EQ(table()->sweep_counter, 1);
  code.reset();
  for (int i = 0; i < 4998; ++i) LookupCOPathname(table(), nullptr);
  EXPECT_EQ(table()->sweep_counter, 4999);
  EXPECT_EQ(entry_count(), 1);
  LookupCOPathname(table(), nullptr);
  EXPECT_EQ(table()->sweep_counter, 0);
  EXPECT_EQ(entry_count(), 0);
}

TEST_F(ConamesTest, SweepKeepsCodeHeldElsewhere) {
  Ref held = compile("x = 1\n", "held.py");
  const Py_ssize_t before = Py_REFCNT(held.get());
  ASSERT_EQ(RegisterCOPathname(table(), held.get(), "/held.py", nullptr, 0), 0);
  run_sweep();
  EXPECT_EQ(lookup(table(), held.get()), "/held.py");
  EXPECT_EQ(Py_REFCNT(held.get()), before + 1);
}

TEST_F(ConamesTest, SweepEmptiesMoreThanOneBatch) {
  std::vector<Ref> kept;
  for (int i = 0; i < 250; ++i) {
    Ref code = lone_code("victim" + std::to_string(i));
    ASSERT_EQ(RegisterCOPathname(table(), code.get(), "/v.py", nullptr, 0), 0);
    if (i % 100 == 42) kept.push_back(code);
  }
  EXPECT_EQ(entry_count(), 250);
  run_sweep();
  EXPECT_EQ(entry_count(), 3);
  EXPECT_EQ(table()->address_index.size(), 3u);
  for (const Ref& code : kept) EXPECT_EQ(lookup(table(), code.get()), "/v.py");
}

TEST_F(ConamesTest, NestedCodeObjectsShareTheParentsName) {
  const char* source =
      "def f():\n"
      "    def inner():\n"
      "        return lambda: 0\n"
      "    return inner\n"
      "class C:\n"
      "    def m(self): pass\n"
      "g = lambda x: x\n";
  Ref code = compile(source, "mod.py");
  std::vector<PyObject*> nested;
  collect_nested(code.get(), &nested);
  ASSERT_EQ(nested.size(), 6u);  // f, inner, its lambda, C's body, m, g's lambda
  ASSERT_EQ(RegisterCOPathname(table(), code.get(), "/src/mod.py", nullptr, 0), 0);
  EXPECT_EQ(entry_count(), 7);
  EXPECT_EQ(lookup(table(), code.get()), "/src/mod.py");
  for (PyObject* inner : nested) EXPECT_EQ(lookup(table(), inner), "/src/mod.py");
}

TEST_F(ConamesTest, ForcedRegistrationRenamesNestedCodeToo) {
  Ref code = compile("def f():\n    pass\n", "mod.py");
  std::vector<PyObject*> nested;
  collect_nested(code.get(), &nested);
  ASSERT_EQ(nested.size(), 1u);
  ASSERT_EQ(RegisterCOPathname(table(), code.get(), "/old/mod.py", nullptr, 0), 0);
  ASSERT_EQ(RegisterCOPathname(table(), code.get(), "/new/mod.py", nullptr, 1), 0);
  EXPECT_EQ(lookup(table(), nested[0]), "/new/mod.py");
  // Both were pinned by the forced registration; give the pins back.
  Py_DECREF(code.get());
  Py_DECREF(nested[0]);
}

TEST_F(ConamesTest, ClearingGivesBackEveryReference) {
  Ref code = compile("def f():\n    pass\n", "mod.py");
  std::vector<PyObject*> nested;
  collect_nested(code.get(), &nested);
  const Py_ssize_t code_before = Py_REFCNT(code.get());
  const Py_ssize_t nested_before = Py_REFCNT(nested[0]);
  ASSERT_EQ(RegisterCOPathname(table(), code.get(), "/mod.py", nullptr, 0), 0);
  EXPECT_EQ(Py_REFCNT(nested[0]), nested_before + 1);
  ClearCOPathnameTable(table());
  EXPECT_EQ(Py_REFCNT(code.get()), code_before);
  EXPECT_EQ(Py_REFCNT(nested[0]), nested_before);
  EXPECT_EQ(LookupCOPathname(table(), code.get()), nullptr);
  EXPECT_TRUE(table()->address_index.empty());
}

TEST_F(ConamesTest, LookupsTakeNoReferences) {
  Ref code = compile("x = 1\n", "m.py");
  ASSERT_EQ(RegisterCOPathname(table(), code.get(), "/m.py", nullptr, 0), 0);
  const Py_ssize_t before = Py_REFCNT(code.get());
  for (int i = 0; i < 100; ++i) LookupCOPathname(table(), code.get());
  EXPECT_EQ(Py_REFCNT(code.get()), before);
}

TEST_F(ConamesTest, RegistrationPrintsNameAddressAndCodeName) {
  Ref code = compile("x = 1\n", "m.py");
  DebugCapture capture;
  ASSERT_EQ(RegisterCOPathname(table(), code.get(), "/p/m.py", nullptr, 0), 0);
  const std::string text = capture.text();
  EXPECT_EQ(text.rfind("Registering /p/m.py as pathname for code object 0x", 0), 0u) << text;
  EXPECT_NE(text.find(" (<module>)\n"), std::string::npos) << text;
}

// ---- Registering a module's functions ----------------------------------------------------

TEST_F(ConamesTest, ModuleFunctionsMethodsAndBoundMethodsAreRegistered) {
  Ref globals = new_globals("/src/mine.py");
  run_in(globals.get(),
         "def f(): pass\n"
         "class C:\n"
         "    def m(self): pass\n"
         "    class D:\n"
         "        def n(self): pass\n"
         "class E:\n"
         "    def bound(self): pass\n"
         "bm = E().bound\n"
         "lam = lambda: 0\n"
         "number = 3\n",
         "mine.py");
  EXPECT_EQ(RegisterMatchingCodeValues(table(), "/src/mine.py", globals.get(), 0), 0);
  PyObject* cls = item(globals.get(), "C");
  Ref m = Ref::steal(PyObject_GetAttrString(cls, "m"));
  Ref d = Ref::steal(PyObject_GetAttrString(cls, "D"));
  Ref n = Ref::steal(PyObject_GetAttrString(d.get(), "n"));
  EXPECT_EQ(lookup(table(), function_code(item(globals.get(), "f"))), "/src/mine.py");
  EXPECT_EQ(lookup(table(), function_code(m.get())), "/src/mine.py");
  EXPECT_EQ(lookup(table(), function_code(n.get())), "/src/mine.py");
  EXPECT_EQ(lookup(table(), function_code(item(globals.get(), "lam"))), "/src/mine.py");
  PyObject* bound = item(globals.get(), "bm");
  EXPECT_EQ(lookup(table(), function_code(PyMethod_GET_FUNCTION(bound))), "/src/mine.py");
}

TEST_F(ConamesTest, FunctionFromAnotherModuleIsNotRegistered) {
  Ref other = new_globals("/src/other.py");
  run_in(other.get(), "def borrowed(): pass\nclass K:\n    def km(self): pass\n", "other.py");
  Ref mine = new_globals("/src/mine.py");
  run_in(mine.get(), "def own(): pass\n", "mine.py");
  PyDict_SetItemString(mine.get(), "borrowed", item(other.get(), "borrowed"));
  PyDict_SetItemString(mine.get(), "K", item(other.get(), "K"));
  ASSERT_EQ(RegisterMatchingCodeValues(table(), "/src/mine.py", mine.get(), 0), 0);
  EXPECT_EQ(lookup(table(), function_code(item(mine.get(), "own"))), "/src/mine.py");
  EXPECT_EQ(LookupCOPathname(table(), function_code(item(other.get(), "borrowed"))), nullptr);
  Ref km = Ref::steal(PyObject_GetAttrString(item(other.get(), "K"), "km"));
  EXPECT_EQ(LookupCOPathname(table(), function_code(km.get())), nullptr);
}

TEST_F(ConamesTest, ClassesNestedTenDeepAreNotSearched) {
  Ref globals = new_globals("/src/deep.py");
  run_in(globals.get(), nested_classes(12), "deep.py");
  ASSERT_EQ(RegisterMatchingCodeValues(table(), "/src/deep.py", globals.get(), 0), 0);
  Ref cls = Ref::borrow(item(globals.get(), "C1"));
  for (int level = 1; level <= 12; ++level) {
    Ref method = Ref::steal(PyObject_GetAttrString(cls.get(), "m"));
    // The dict of class k is walked at depth k and its method reached at depth k + 1;
    // depth 9 is the last one handled.
    const bool expected = level + 1 <= 9;
    EXPECT_EQ(LookupCOPathname(table(), function_code(method.get())) != nullptr, expected)
        << "method of C" << level;
    if (level < 12) {
      cls =
          Ref::steal(PyObject_GetAttrString(cls.get(), ("C" + std::to_string(level + 1)).c_str()));
    }
  }
}

TEST_F(ConamesTest, DictWalkStopsBelowDepthTen) {
  Ref globals = new_globals("/src/w.py");
  run_in(globals.get(), "def f(): pass\n", "w.py");
  RegisterMatchingContext context{table(), "/src/w.py", globals.get(), 0};
  EXPECT_EQ(RegisterMatchingDictValues(&context, globals.get(), 10), 0);
  EXPECT_EQ(entry_count(), 0);
  EXPECT_EQ(RegisterMatchingDictValues(&context, globals.get(), 8), 0);
  EXPECT_EQ(lookup(table(), function_code(item(globals.get(), "f"))), "/src/w.py");
}

TEST_F(ConamesTest, MatchingFunctionRules) {
  Ref globals = new_globals("/src/r.py");
  run_in(globals.get(), "def f(): pass\n", "r.py");
  PyObject* f = item(globals.get(), "f");
  RegisterMatchingContext context{table(), "/src/r.py", globals.get(), 0};
  EXPECT_EQ(RegisterMatchingFunction(&context, Py_None, 1), -1);
  EXPECT_EQ(RegisterMatchingFunction(&context, f, 10), 0);
  EXPECT_EQ(LookupCOPathname(table(), function_code(f)), nullptr);
  Ref stranger = new_globals("/src/s.py");
  RegisterMatchingContext other{table(), "/src/s.py", stranger.get(), 0};
  EXPECT_EQ(RegisterMatchingFunction(&other, f, 1), 0);
  EXPECT_EQ(LookupCOPathname(table(), function_code(f)), nullptr);
  EXPECT_EQ(RegisterMatchingFunction(&context, f, 9), 0);
  EXPECT_EQ(lookup(table(), function_code(f)), "/src/r.py");
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

TEST_F(ConamesTest, MatchingWithoutGlobalsDictDoesNothing) {
  EXPECT_EQ(RegisterMatchingCodeValues(table(), "/src/x.py", nullptr, 0), 0);
  EXPECT_EQ(RegisterMatchingCodeValues(table(), "/src/x.py", Py_None, 0), 0);
  EXPECT_FALSE(table()->dict);
}

TEST_F(ConamesTest, MatchingWalkPrintsWhatItExamines) {
  Ref globals = new_globals("");
  run_in(globals.get(), "def f(): pass\n", "p.py");
  DebugCapture capture;
  RegisterMatchingCodeValues(table(), "/src/p.py", globals.get(), 0);
  const std::string text = capture.text();
  EXPECT_NE(text.find("RegisterMatchingCodeValues: globals = 0x"), std::string::npos) << text;
  EXPECT_NE(text.find("; pathname = /src/p.py; globals = 0x"), std::string::npos) << text;
  EXPECT_NE(text.find("Starting iteration; dict len = 2"), std::string::npos) << text;
  EXPECT_NE(text.find("Examining f: type is function\n"), std::string::npos) << text;
  EXPECT_NE(text.find("RegisterMatchingFunction called on f; depth = 1\n"), std::string::npos)
      << text;
}

TEST_F(ConamesTest, MatchingTwiceTakesNoFurtherReferences) {
  Ref globals = new_globals("/src/t.py");
  run_in(globals.get(), "def f(): pass\n", "t.py");
  PyObject* code = function_code(item(globals.get(), "f"));
  ASSERT_EQ(RegisterMatchingCodeValues(table(), "/src/t.py", globals.get(), 0), 0);
  const Py_ssize_t after_first = Py_REFCNT(code);
  ASSERT_EQ(RegisterMatchingCodeValues(table(), "/src/t.py", globals.get(), 0), 0);
  EXPECT_EQ(Py_REFCNT(code), after_first);
}

}  // namespace

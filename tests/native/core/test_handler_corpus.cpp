// test_handler_corpus.cpp: the handler analysis against a generated corpus of programs
// (tests/exc_corpus.py). The corpus runs each program untraced and reports, for each numbered
// raise, whether its exception object left the program; here the same program runs again
// under a C trace function that asks predict_catch (match kind 0, all frames) at the first
// exception event of each numbered object. A sure answer (caught, uncaught) must agree with
// the truth for every shape the analysis reads; "may be caught" (C code between frames, a
// `with` exit) is allowed either way and counted. Shapes it deliberately does not read (a
// call in the class expression) are only counted. The programs of the boundary corpus (C
// code and `with` blocks of every kind) follow those of the plain corpus.
//
// SELVANE_CORPUS_COUNT sets the number of programs (default 600).
#include <Python.h>
#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <map>
#include <string>
#include <vector>

#include "core_test_support.h"
#include "exc/handlers.h"

namespace {

// The tests/ directory of the source tree, from this file's own path.
std::string tests_dir() {
  std::string here = __FILE__;
  for (int up = 0; up < 3; ++up) here = here.substr(0, here.find_last_of('/'));
  return here;
}

// Predictions per raise number, taken at the first event of each numbered exception.
struct Predictions {
  std::map<long, CatchKind> kinds;
  Ref seq_name;
};

int record_prediction(PyObject* obj, PyFrameObject* frame, int what, PyObject* arg) {
  if (what != PyTrace_EXCEPTION || !PyTuple_Check(arg) || PyTuple_GET_SIZE(arg) < 2) return 0;
  auto* predictions = static_cast<Predictions*>(PyCapsule_GetPointer(obj, nullptr));
  PyObject* exc = PyTuple_GET_ITEM(arg, 1);
  Ref seq = Ref::steal(PyObject_GetAttr(exc, predictions->seq_name.get()));
  if (!seq) {
    PyErr_Clear();
    return 0;
  }
  long number = PyLong_AsLong(seq.get());
  if (predictions->kinds.count(number) != 0) return 0;
  CatchQuestion question;
  question.frame = reinterpret_cast<PyObject*>(frame);
  question.exc = exc;
  predictions->kinds[number] = predict_catch(question).kind;
  return 0;
}

class HandlerCorpus : public coretest::PythonTest {
 protected:
  static void SetUpTestSuite() { ASSERT_EQ(init_handler_analysis(), 0); }
};

TEST_F(HandlerCorpus, PredictionsAgreeWithRunningThePrograms) {
  Ref sys_path = Ref::borrow(PySys_GetObject("path"));
  Ref dir = Ref::steal(PyUnicode_FromString(tests_dir().c_str()));
  ASSERT_EQ(PyList_Insert(sys_path.get(), 0, dir.get()), 0);
  Ref corpus_module = Ref::steal(PyImport_ImportModule("exc_corpus"));
  ASSERT_TRUE(corpus_module) << "tests/exc_corpus.py not importable from " << tests_dir();
  const char* count_text = std::getenv("SELVANE_CORPUS_COUNT");
  long count = count_text != nullptr ? std::atol(count_text) : 600;
  Ref corpus = Ref::steal(PyObject_CallMethod(corpus_module.get(), "corpus", "l", count));
  ASSERT_TRUE(corpus);
  Ref boundary = Ref::steal(PyObject_CallMethod(corpus_module.get(), "boundary_corpus", nullptr));
  ASSERT_TRUE(boundary);
  Ref itertools = Ref::steal(PyImport_ImportModule("itertools"));
  ASSERT_TRUE(itertools);
  Ref all =
      Ref::steal(PyObject_CallMethod(itertools.get(), "chain", "OO", corpus.get(), boundary.get()));
  ASSERT_TRUE(all);
  Ref iterator = Ref::steal(PyObject_GetIter(all.get()));
  ASSERT_TRUE(iterator);

  struct Tally {
    int raises = 0, agree = 0, escaping = 0, uncertain = 0;
  };
  std::map<std::string, Tally> tallies;
  std::vector<std::string> disagreements;
  int programs = 0;
  for (;;) {
    // The corpus runs each program untraced while it yields it.
    Ref record = Ref::steal(PyIter_Next(iterator.get()));
    if (!record) break;
    ++programs;
    const char* name = PyUnicode_AsUTF8(PyTuple_GET_ITEM(record.get(), 0));
    std::string category = PyUnicode_AsUTF8(PyTuple_GET_ITEM(record.get(), 1));
    const char* text = PyUnicode_AsUTF8(PyTuple_GET_ITEM(record.get(), 2));
    PyObject* raises = PyTuple_GET_ITEM(record.get(), 3);

    Predictions predictions;
    predictions.seq_name = Ref::steal(PyUnicode_FromString("_corpus_seq"));
    Ref code = Ref::steal(Py_CompileString(text, "<corpus>", Py_file_input));
    ASSERT_TRUE(code) << name;
    Ref globals = Ref::steal(PyDict_New());
    PyDict_SetItemString(globals.get(), "__builtins__", PyEval_GetBuiltins());
    Ref module_name = Ref::steal(PyUnicode_FromString("__corpus__"));
    PyDict_SetItemString(globals.get(), "__name__", module_name.get());
    Ref capsule = Ref::steal(PyCapsule_New(&predictions, nullptr, nullptr));
    PyEval_SetTrace(record_prediction, capsule.get());
    Ref result = Ref::steal(PyEval_EvalCode(code.get(), globals.get(), globals.get()));
    PyEval_SetTrace(nullptr, nullptr);
    if (!result) PyErr_Clear();

    for (Py_ssize_t i = 0; i < PyList_GET_SIZE(raises); ++i) {
      PyObject* raise = PyList_GET_ITEM(raises, i);
      long seq = PyLong_AsLong(PyTuple_GET_ITEM(raise, 0));
      const char* tag = PyUnicode_AsUTF8(PyTuple_GET_ITEM(raise, 1));
      bool escaped = PyObject_IsTrue(PyTuple_GET_ITEM(raise, 2)) == 1;
      Tally& tally = tallies[category];
      ++tally.raises;
      tally.escaping += escaped ? 1 : 0;
      auto found = predictions.kinds.find(seq);
      if (found == predictions.kinds.end()) {
        disagreements.push_back(std::string(name) + " " + tag + ": no exception event");
        continue;
      }
      if (found->second == CatchKind::kCCode || found->second == CatchKind::kWith) {
        ++tally.uncertain;
        continue;
      }
      bool predicted_handled = found->second == CatchKind::kCaught;
      if (predicted_handled == !escaped) {
        ++tally.agree;
      } else if (category != "unknown") {
        disagreements.push_back(std::string(name) + " " + tag + ": predicted " +
                                (predicted_handled ? "caught" : "escaping") + ", really " +
                                (escaped ? "escaped" : "caught") + "\n" + text);
      }
    }
  }
  ASSERT_EQ(PyErr_Occurred(), nullptr) << "the corpus generator failed";
  EXPECT_GT(programs, 0);
  std::printf("handler corpus on %s: %d programs\n", Py_GetVersion(), programs);
  for (const auto& [category, tally] : tallies) {
    std::printf("  %-8s %5d raises (%d escaping), %5d agree, %5d may be caught, %5d disagree\n",
                category.c_str(), tally.raises, tally.escaping, tally.agree, tally.uncertain,
                tally.raises - tally.agree - tally.uncertain);
  }
  EXPECT_GT(tallies["plain"].escaping, 0);
  EXPECT_LT(tallies["plain"].escaping, tallies["plain"].raises);
  // The boundary programs really reach C code and `with` exits, and the exact with blocks
  // (suppress, @contextmanager) and sure catches still answer for many of them.
  EXPECT_GT(tallies["boundary"].uncertain, 0);
  EXPECT_GT(tallies["boundary"].agree, tallies["boundary"].raises / 4);
  EXPECT_TRUE(disagreements.empty()) << disagreements.size() << " disagreements, first:\n"
                                     << (disagreements.empty() ? "" : disagreements.front());
}

}  // namespace

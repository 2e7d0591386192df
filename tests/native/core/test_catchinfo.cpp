// test_catchinfo.cpp: the catch-info index and its matching against real frames, and the
// containing-class lookup it uses.
//
// The frames come from functions of one test module (its __name__ is "appmod"): a module
// function, methods of top-level classes, of a class made in a function and of a nested
// class, all with the same code name "handler".
#include <Python.h>
#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "core_test_support.h"
#include "exc/exceptops.h"
#include "names/containing_class.h"

namespace {

using coretest::item;

constexpr const char* kProgram = R"(
__name__ = 'appmod'
import sys, collections

def handler():
    return sys._getframe()

class Widget:
    def handler(self):
        return sys._getframe()
    @staticmethod
    def static_handler():
        return sys._getframe()
    @classmethod
    def class_handler(cls):
        return sys._getframe()

class Gadget:
    def handler(self):
        return sys._getframe()

def make_local():
    class Local:
        def handler(self):
            return sys._getframe()
    return Local

class Outer:
    class Inner:
        def handler(self):
            return sys._getframe()

def _hidden():
    class Hidden:
        def handler(self):
            return sys._getframe()
    return Hidden

# Bound at the top level under two names, neither of them the class's own.
Shown = _hidden()
AlsoShown = Shown

class First:
    def shared(self):
        return sys._getframe()

class Second:
    shared = First.shared

class Base:
    def inherited(self):
        return sys._getframe()

class Derived(Base):
    pass

def wrap(f):
    def wrapper(*a):
        return f(*a)
    return wrapper

class Decorated:
    @wrap
    def handler(self):
        return sys._getframe()

class Copy:
    pass
Copy.handler = type(Widget.handler)(Widget.handler.__code__.replace(), globals())

frames = {
    'module': handler(),
    'widget': Widget().handler(),
    'gadget': Gadget().handler(),
    'local': make_local()().handler(),
    'inner': Outer.Inner().handler(),
    'static': Widget.static_handler(),
    'classmethod': Widget.class_handler(),
    'hidden': Shown().handler(),
    'shared': First().shared(),
    'inherited': Derived().inherited(),
    'decorated': Decorated().handler(),
}

reads = []

class Info:
    def __init__(self, co_name, mod_name='*', containing_class='*', prints=True, parent=False,
                 tag=''):
        self.co_name, self.mod_name, self.containing_class = co_name, mod_name, containing_class
        self.prints, self.parent, self.tag = prints, parent, tag

class NoClass:
    def __init__(self, co_name, mod_name='*', tag=''):
        self.co_name, self.mod_name, self.tag = co_name, mod_name, tag
        self.prints, self.parent = True, False

class WatchedClass:
    # Records every read of its containing_class, which raises.
    def __init__(self, co_name, mod_name, tag=''):
        self.co_name, self.mod_name, self.tag = co_name, mod_name, tag
        self.prints, self.parent = True, False
    @property
    def containing_class(self):
        reads.append(self.tag)
        raise RuntimeError('containing_class read')

class NoModule:
    def __init__(self, co_name):
        self.co_name, self.containing_class, self.prints, self.parent = co_name, '*', 1, 0

class NoPrints:
    def __init__(self, co_name):
        self.co_name, self.mod_name, self.containing_class = co_name, '*', '*'
        self.parent = False

class RaisingParent(Info):
    @property
    def parent(self):
        raise ValueError('parent')
    @parent.setter
    def parent(self, value):
        pass
)";

class CatchInfoTest : public coretest::PythonTest {
 protected:
  void SetUp() override {
    PythonTest::SetUp();
    ns_ = coretest::make_namespace(kProgram);
    init_exc_data(&data_);
  }
  void TearDown() override {
    init_exc_data(&data_);
    data_.dunder_name_str.reset();
    data_.containing_class_str.reset();
    ns_.reset();
    PythonTest::TearDown();
  }
  PyObject* frame(const char* name) {
    PyObject* frames = item(ns_.get(), "frames");
    PyObject* f = PyDict_GetItemString(frames, name);
    EXPECT_NE(f, nullptr) << name;
    return f;
  }
  PyObject* code_of(const char* frame_name) {
    codes_.push_back(Ref::steal(reinterpret_cast<PyObject*>(
        PyFrame_GetCode(reinterpret_cast<PyFrameObject*>(frame(frame_name))))));
    return codes_.back().get();
  }
  // A catch-info instance made by calling a class of the test module with Python source
  // arguments, for instance info("Info", "'handler', 'appmod', 'Widget', tag='w'").
  Ref info(const char* cls, const std::string& args) {
    Ref made = eval(std::string(cls) + "(" + args + ")");
    return made;
  }
  Ref eval(const std::string& expression) {
    Ref result = Ref::steal(
        PyRun_String(expression.c_str(), Py_eval_input, ns_.get(), ns_.get()));
    if (!result) {
      PyErr_Print();
      ADD_FAILURE() << "could not evaluate " << expression;
    }
    return result;
  }
  // Builds the index from a list expression; returns set_catch_info_list's result.
  int set_list(const std::string& list_expression) {
    Ref list = eval(list_expression);
    return set_catch_info_list(&data_, list.get());
  }
  // The tag of the instance found for a frame, "" when none.
  std::string found_tag(const char* frame_name) {
    Ref found = Ref::steal(find_catch_info(&data_, frame(frame_name)));
    EXPECT_EQ(PyErr_Occurred(), nullptr) << "find_catch_info left an error";
    if (!found) return "";
    Ref tag = Ref::steal(PyObject_GetAttrString(found.get(), "tag"));
    return tag ? PyUnicode_AsUTF8(tag.get()) : "?";
  }
  std::string class_name_of(PyObject* cls) {
    const char* name = GetPyClassName(cls);
    return name != nullptr ? name : "(null)";
  }

  Ref ns_;
  ExcData data_;
  std::vector<Ref> codes_;
};

// ---- the containing class --------------------------------------------------------------------

TEST_F(CatchInfoTest, ModuleFunctionHasNoContainingClass) {
  Ref cls = Ref::steal(GetContainingClass(code_of("module"), ns_.get()));
  ASSERT_TRUE(cls);
  EXPECT_TRUE(cls.is_none());
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

TEST_F(CatchInfoTest, MethodOfATopLevelClassFindsThatClass) {
  Ref cls = Ref::steal(GetContainingClass(code_of("widget"), ns_.get()));
  EXPECT_TRUE(cls.is(item(ns_.get(), "Widget")));
  EXPECT_EQ(class_name_of(cls.get()), "Widget");
  cls = Ref::steal(GetContainingClass(code_of("gadget"), ns_.get()));
  EXPECT_TRUE(cls.is(item(ns_.get(), "Gadget")));
}

TEST_F(CatchInfoTest, ClassesInsideFunctionsOrOtherClassesAreNotSearched) {
  for (const char* name : {"local", "inner"}) {
    Ref cls = Ref::steal(GetContainingClass(code_of(name), ns_.get()));
    ASSERT_TRUE(cls) << name;
    EXPECT_TRUE(cls.is_none()) << name;
  }
}

TEST_F(CatchInfoTest, DecoratedStaticAndClassMethodsAndBaseClassesAreNotFound) {
  for (const char* name : {"static", "classmethod", "decorated"}) {
    Ref cls = Ref::steal(GetContainingClass(code_of(name), ns_.get()));
    ASSERT_TRUE(cls) << name;
    EXPECT_TRUE(cls.is_none()) << name;
  }
  // Found in the class that defines it, never through a subclass.
  Ref cls = Ref::steal(GetContainingClass(code_of("inherited"), ns_.get()));
  EXPECT_TRUE(cls.is(item(ns_.get(), "Base")));
  Ref none = Ref::steal(FindInSingleClass(item(ns_.get(), "Derived"), code_of("inherited")));
  EXPECT_TRUE(none.is_none());
}

TEST_F(CatchInfoTest, CodeIsComparedByIdentity) {
  // Copy holds a function with an equal copy of Widget.handler's code object.
  PyObject* code = code_of("widget");
  Ref copy_fn = Ref::steal(PyObject_GetAttrString(item(ns_.get(), "Copy"), "handler"));
  ASSERT_TRUE(copy_fn);
  PyObject* copy_code = PyFunction_GET_CODE(copy_fn.get());
  ASSERT_NE(copy_code, code);
  ASSERT_EQ(PyObject_RichCompareBool(copy_code, code, Py_EQ), 1);
  Ref none = Ref::steal(FindInSingleClass(item(ns_.get(), "Copy"), code));
  EXPECT_TRUE(none.is_none());
  Ref found = Ref::steal(FindInSingleClass(item(ns_.get(), "Widget"), code));
  EXPECT_TRUE(found.is(item(ns_.get(), "Widget")));
}

TEST_F(CatchInfoTest, FirstBindingInDictionaryOrderWinsAndTheClassKeepsItsOwnName) {
  // Shown and AlsoShown are one class, whose own name is Hidden.
  Ref cls = Ref::steal(GetContainingClass(code_of("hidden"), ns_.get()));
  EXPECT_TRUE(cls.is(item(ns_.get(), "Shown")));
  EXPECT_EQ(class_name_of(cls.get()), "Hidden");
  // One function in two classes: First comes first in the module's dictionary...
  cls = Ref::steal(GetContainingClass(code_of("shared"), ns_.get()));
  EXPECT_EQ(class_name_of(cls.get()), "First");
  // ... until it is bound again, which moves it after Second.
  Ref first = Ref::borrow(item(ns_.get(), "First"));
  ASSERT_EQ(PyDict_DelItemString(ns_.get(), "First"), 0);
  ASSERT_EQ(PyDict_SetItemString(ns_.get(), "First", first.get()), 0);
  cls = Ref::steal(GetContainingClass(code_of("shared"), ns_.get()));
  EXPECT_EQ(class_name_of(cls.get()), "Second");
}

TEST_F(CatchInfoTest, ClassNameOnlyForClasses) {
  EXPECT_EQ(GetPyClassName(Py_None), nullptr);
  EXPECT_EQ(GetPyClassName(frame("module")), nullptr);
  Ref instance = eval("Widget()");
  EXPECT_EQ(GetPyClassName(instance.get()), nullptr);
  EXPECT_EQ(class_name_of(reinterpret_cast<PyObject*>(&PyDict_Type)), "dict");
  // A built-in class: its tp_name, with the module in it.
  Ref deque = eval("collections.deque");
  EXPECT_EQ(class_name_of(deque.get()), "collections.deque");
  Ref none = Ref::steal(FindInSingleClass(instance.get(), code_of("widget")));
  EXPECT_TRUE(none.is_none());
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

// ---- the index ----------------------------------------------------------------------------------

TEST_F(CatchInfoTest, FirstInstanceWhoseModuleAndClassMatchIsUsed) {
  ASSERT_EQ(set_list("[Info('handler', 'othermod', '*', tag='other module'),"
                     " Info('handler', 'appmod', 'Gadget', tag='other class'),"
                     " Info('handler', 'appmod', 'Widget', tag='first'),"
                     " Info('handler', '*', '*', tag='second')]"),
            0);
  EXPECT_EQ(found_tag("widget"), "first");
  EXPECT_EQ(found_tag("gadget"), "other class");
  EXPECT_EQ(found_tag("module"), "second");
}

TEST_F(CatchInfoTest, StarsMatchEveryFunctionOfThatName) {
  ASSERT_EQ(set_list("[Info('handler', '*', '*', tag='any')]"), 0);
  for (const char* name : {"module", "widget", "gadget", "local", "inner", "hidden",
                           "decorated"}) {
    EXPECT_EQ(found_tag(name), "any") << name;
  }
  // Other code names are not indexed.
  EXPECT_EQ(found_tag("static"), "");
  EXPECT_EQ(found_tag("shared"), "");
}

TEST_F(CatchInfoTest, ModuleFunctionMatchesOnlyAnyClass) {
  ASSERT_EQ(set_list("[Info('handler', 'appmod', 'Widget', tag='widget'),"
                     " Info('handler', 'appmod', 'None', tag='none'),"
                     " Info('handler', 'appmod', '', tag='empty')]"),
            0);
  EXPECT_EQ(found_tag("module"), "");
  EXPECT_EQ(found_tag("widget"), "widget");
  ASSERT_EQ(set_list("[Info('handler', 'appmod', '*', tag='any')]"), 0);
  EXPECT_EQ(found_tag("module"), "any");
}

TEST_F(CatchInfoTest, MissingContainingClassEndsTheSearch) {
  ASSERT_EQ(set_list("[NoClass('handler', 'appmod', tag='no class'),"
                     " Info('handler', '*', '*', tag='later')]"),
            0);
  EXPECT_EQ(found_tag("module"), "");
  EXPECT_EQ(found_tag("widget"), "");
  // A containing_class that is not a string fails the same way.
  ASSERT_EQ(set_list("[Info('handler', '*', 3, tag='number'), Info('handler', tag='later')]"),
            0);
  EXPECT_EQ(found_tag("widget"), "");
  // A module that does not match comes first: the instance is passed over.
  ASSERT_EQ(set_list("[NoClass('handler', 'othermod', tag='no class'),"
                     " Info('handler', '*', '*', tag='later')]"),
            0);
  EXPECT_EQ(found_tag("module"), "later");
}

TEST_F(CatchInfoTest, ContainingClassIsNotReadWhenTheModuleDiffers) {
  ASSERT_EQ(set_list("[WatchedClass('handler', 'othermod', tag='skipped'),"
                     " Info('handler', 'appmod', '*', tag='used')]"),
            0);
  EXPECT_EQ(found_tag("widget"), "used");
  Ref reads = eval("len(reads)");
  EXPECT_EQ(PyLong_AsLong(reads.get()), 0);
  // When the module matches it is read, and its error ends the search, cleared.
  ASSERT_EQ(set_list("[WatchedClass('handler', 'appmod', tag='read'),"
                     " Info('handler', 'appmod', '*', tag='used')]"),
            0);
  EXPECT_EQ(found_tag("widget"), "");
  reads = eval("reads");
  Ref expected = eval("['read']");
  EXPECT_EQ(PyObject_RichCompareBool(reads.get(), expected.get(), Py_EQ), 1);
}

TEST_F(CatchInfoTest, ModuleNameThatIsNotAStringIsAPlainMismatch) {
  ASSERT_EQ(set_list("[Info('handler', None, tag='none'), Info('handler', 5, tag='five'),"
                     " Info('handler', 'appmod', tag='used')]"),
            0);
  EXPECT_EQ(found_tag("module"), "used");
  // A missing mod_name, unlike one of the wrong type, is a failure that ends the search.
  ASSERT_EQ(set_list("[NoModule('handler'), Info('handler', 'appmod', tag='later')]"), 0);
  EXPECT_EQ(found_tag("module"), "");
}

TEST_F(CatchInfoTest, ModuleNameMatchingDirectly) {
  Ref star = Ref::steal(PyUnicode_FromString("*"));
  Ref app = Ref::steal(PyUnicode_FromString("appmod"));
  Ref other = Ref::steal(PyUnicode_FromString("other"));
  PyObject* f = frame("widget");
  EXPECT_EQ(mod_name_matches(&data_, star.get(), f), 1);
  EXPECT_EQ(mod_name_matches(&data_, app.get(), f), 1);
  EXPECT_EQ(mod_name_matches(&data_, other.get(), f), 0);
  EXPECT_EQ(mod_name_matches(&data_, nullptr, f), 0);
  EXPECT_EQ(mod_name_matches(&data_, Py_None, f), 0);
  EXPECT_EQ(mod_name_matches(&data_, star.get(), Py_None), 0);
  // A module without a string __name__ matches only "*".
  ASSERT_EQ(PyDict_SetItemString(ns_.get(), "__name__", Py_None), 0);
  EXPECT_EQ(mod_name_matches(&data_, app.get(), f), 0);
  EXPECT_EQ(mod_name_matches(&data_, star.get(), f), 1);
  ASSERT_EQ(PyDict_DelItemString(ns_.get(), "__name__"), 0);
  EXPECT_EQ(mod_name_matches(&data_, app.get(), f), 0);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

TEST_F(CatchInfoTest, ContainingClassMatchingDirectly) {
  Ref widget = info("Info", "'handler', '*', 'Widget'");
  Ref star = info("Info", "'handler', '*', '*'");
  Ref hidden = info("Info", "'handler', '*', 'Hidden'");
  Ref shown = info("Info", "'handler', '*', 'Shown'");
  Ref missing = info("NoClass", "'handler'");
  EXPECT_EQ(containing_class_matches(&data_, widget.get(), frame("widget")), 1);
  EXPECT_EQ(containing_class_matches(&data_, widget.get(), frame("gadget")), 0);
  EXPECT_EQ(containing_class_matches(&data_, widget.get(), frame("module")), 0);
  EXPECT_EQ(containing_class_matches(&data_, star.get(), frame("module")), 1);
  // The class's own name counts, not the name it is bound to.
  EXPECT_EQ(containing_class_matches(&data_, hidden.get(), frame("hidden")), 1);
  EXPECT_EQ(containing_class_matches(&data_, shown.get(), frame("hidden")), 0);
  EXPECT_EQ(containing_class_matches(&data_, star.get(), Py_None), -1);
  EXPECT_EQ(containing_class_matches(&data_, missing.get(), frame("widget")), -1);
  PyErr_Clear();
}

TEST_F(CatchInfoTest, PrintsAndParent) {
  ASSERT_EQ(set_list("[Info('handler', '*', 'Widget', True, False),"
                     " Info('handler', '*', 'Gadget', True, True),"
                     " Info('handler', '*', 'Hidden', False, True),"
                     " Info('handler', '*', '*', 0, 0)]"),
            0);
  EXPECT_EQ(frame_prints_exc(&data_, frame("widget")), 1);
  EXPECT_EQ(parent_frame_prints_exc(&data_, frame("widget")), 0);
  EXPECT_EQ(frame_prints_exc(&data_, frame("gadget")), 0);
  EXPECT_EQ(parent_frame_prints_exc(&data_, frame("gadget")), 1);
  EXPECT_EQ(frame_prints_exc(&data_, frame("hidden")), 0);
  EXPECT_EQ(parent_frame_prints_exc(&data_, frame("hidden")), 0);
  EXPECT_EQ(frame_prints_exc(&data_, frame("module")), 0);
  EXPECT_EQ(parent_frame_prints_exc(&data_, frame("module")), 0);
  EXPECT_EQ(frame_prints_exc(&data_, frame("static")), 0);
  // Attributes that cannot be read: no, and no error left.
  ASSERT_EQ(set_list("[NoPrints('handler')]"), 0);
  EXPECT_EQ(frame_prints_exc(&data_, frame("widget")), 0);
  EXPECT_EQ(parent_frame_prints_exc(&data_, frame("widget")), 0);
  ASSERT_EQ(set_list("[RaisingParent('handler')]"), 0);
  EXPECT_EQ(frame_prints_exc(&data_, frame("widget")), 0);
  EXPECT_EQ(parent_frame_prints_exc(&data_, frame("widget")), 0);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

TEST_F(CatchInfoTest, EmptyListOrNonListRemovesTheIndex) {
  ASSERT_EQ(set_list("[Info('handler', tag='x')]"), 0);
  ASSERT_TRUE(data_.catch_info);
  EXPECT_EQ(set_list("[]"), 0);
  EXPECT_FALSE(data_.catch_info);
  EXPECT_EQ(found_tag("module"), "");
  ASSERT_EQ(set_list("[Info('handler', tag='x')]"), 0);
  EXPECT_EQ(set_list("(Info('handler', tag='y'),)"), 0);
  EXPECT_FALSE(data_.catch_info);
  EXPECT_EQ(found_tag("module"), "");
}

TEST_F(CatchInfoTest, IndexKeepsTheListOrderPerName) {
  ASSERT_EQ(set_list("[Info('handler', tag='a'), Info('other', tag='b'),"
                     " Info('handler', tag='c')]"),
            0);
  Ref expected = eval("{'handler': ['a', 'c'], 'other': ['b']}");
  Ref actual = Ref::steal(PyDict_New());
  Py_ssize_t pos = 0;
  PyObject *key, *value;
  while (PyDict_Next(data_.catch_info.get(), &pos, &key, &value)) {
    ASSERT_TRUE(PyList_CheckExact(value));
    Ref tags = Ref::steal(PyList_New(0));
    for (Py_ssize_t i = 0; i < PyList_GET_SIZE(value); ++i) {
      Ref tag = Ref::steal(PyObject_GetAttrString(PyList_GET_ITEM(value, i), "tag"));
      PyList_Append(tags.get(), tag.get());
    }
    PyDict_SetItem(actual.get(), key, tags.get());
  }
  EXPECT_EQ(PyObject_RichCompareBool(actual.get(), expected.get(), Py_EQ), 1);
}

TEST_F(CatchInfoTest, ItemWithoutAFunctionNameFailsAndKeepsTheItemsBeforeIt) {
  EXPECT_EQ(set_list("[Info('handler', tag='kept'), Widget(), Info('other', tag='lost')]"), -1);
  Ref error = coretest::take_pending_exception();
  ASSERT_TRUE(error);
  EXPECT_TRUE(PyErr_GivenExceptionMatches(error.get(), PyExc_AttributeError));
  ASSERT_TRUE(data_.catch_info);
  EXPECT_EQ(PyDict_GET_SIZE(data_.catch_info.get()), 1);
  EXPECT_EQ(found_tag("module"), "kept");
}

TEST_F(CatchInfoTest, NotAFrameOrNoIndexFindsNothing) {
  Ref none = Ref::steal(find_catch_info(&data_, frame("module")));
  EXPECT_FALSE(none);
  ASSERT_EQ(set_list("[Info('handler', tag='x')]"), 0);
  none = Ref::steal(find_catch_info(&data_, Py_None));
  EXPECT_FALSE(none);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

}  // namespace

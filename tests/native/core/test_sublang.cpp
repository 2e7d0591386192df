// test_sublang.cpp: the sub-language state: registration and lazy loading of hooks, the
// stepping action a hook is told, and the implementation cache, which must forget a code
// object when the pathname table lets it go (its address may be reused).
#include <Python.h>
#include <gtest/gtest.h>

#include "core/sublang.h"
#include "core/tracercore.h"
#include "names/conames.h"
#include "tracer_fixture.h"

namespace {

using coretest::item;
using coretest::make_namespace;
using coretest::run_in_frame;

constexpr const char* kProgram = R"(
class Hook:
    def __init__(self, markers, paths, frames):
        self.markers, self.paths, self.frames = markers, paths, frames
        self.asked = 0
    def _GetMarkerFrames(self):
        self.asked += 1
        return list(self.markers)
    def _GetModulePaths(self):
        return list(self.paths)
    def _GetSubLanguageFrames(self):
        return list(self.frames)

def engine_step():
    probe()

def key():
    pass

empty = Hook([], [], [])
full = Hook([engine_step.__code__], [('/impl/', 7)], [key.__code__])
)";

class SubLanguageTest : public coretest::TracerStateTest {
 protected:
  void SetUp() override {
    TracerStateTest::SetUp();
    __tracer_init_sub_language_state(&gSelf.sub_language);
    ns_ = make_namespace(kProgram);
    data_ = insert_thread_data(&gSelf.thread_table, PyThreadState_Get());
    ASSERT_NE(data_, nullptr);
  }
  void TearDown() override {
    __tracer_init_sub_language_state(&gSelf.sub_language);
    TracerStateTest::TearDown();
  }
  PyObject* get(const char* name) { return item(ns_.get(), name); }
  PyObject* code_of(const char* function) {
    return PyObject_GetAttrString(get(function), "__code__");  // new reference
  }

  Ref ns_;
  ThreadData* data_ = nullptr;
};

TEST_F(SubLanguageTest, RegistrationAsksTheHookNothingAndEnables) {
  ASSERT_EQ(__tracer_register_sub_language_hook(get("empty")), 0);
  EXPECT_EQ(gSelf.sub_language.enabled, 1);
  ASSERT_TRUE(gSelf.sub_language.pending_hooks);
  EXPECT_EQ(PyList_GET_SIZE(gSelf.sub_language.pending_hooks.get()), 1);
  Ref asked = Ref::steal(PyObject_GetAttrString(get("empty"), "asked"));
  EXPECT_EQ(PyLong_AsLong(asked.get()), 0);
}

TEST_F(SubLanguageTest, AHookWithEmptyListsStaysPendingAndIsAskedAgain) {
  ASSERT_EQ(__tracer_register_sub_language_hook(get("empty")), 0);
  ASSERT_EQ(__tracer_register_sub_language_hook(get("full")), 0);
  __tracer_load_pending_sub_language_hooks();
  __tracer_load_pending_sub_language_hooks();
  ASSERT_TRUE(gSelf.sub_language.pending_hooks);
  ASSERT_EQ(PyList_GET_SIZE(gSelf.sub_language.pending_hooks.get()), 1);
  EXPECT_EQ(PyList_GET_ITEM(gSelf.sub_language.pending_hooks.get(), 0), get("empty"));
  Ref asked = Ref::steal(PyObject_GetAttrString(get("empty"), "asked"));
  EXPECT_EQ(PyLong_AsLong(asked.get()), 2);
  Ref full_asked = Ref::steal(PyObject_GetAttrString(get("full"), "asked"));
  EXPECT_EQ(PyLong_AsLong(full_asked.get()), 1);  // loaded once, never asked again
  Ref key = Ref::steal(code_of("key"));
  EXPECT_EQ(PyDict_GetItem(gSelf.sub_language.key_frames.get(), key.get()), get("full"));
}

TEST_F(SubLanguageTest, TheActionFollowsTheSteppingState) {
  ASSERT_EQ(__tracer_register_sub_language_hook(get("full")), 0);
  __tracer_load_pending_sub_language_hooks();
  data_->stop_frame.reset();
  EXPECT_EQ(__tracer_sub_language_get_action(data_), -1);
  data_->stop_frame = Ref::none();
  data_->step_out_frame = Ref::none();
  EXPECT_EQ(__tracer_sub_language_get_action(data_), 0);
  run_in_frame(ns_.get(), "engine_step", [&](PyFrameObject* frame) {
    data_->stop_frame = Ref::borrow(reinterpret_cast<PyObject*>(frame));
    EXPECT_EQ(__tracer_sub_language_get_action(data_), -1);  // not a key frame
    data_->step_out_frame = Ref::borrow(reinterpret_cast<PyObject*>(frame));
    EXPECT_EQ(__tracer_sub_language_get_action(data_), 2);
  });
  data_->stop_frame.reset();
  data_->step_out_frame = Ref::none();
}

TEST_F(SubLanguageTest, TheImplementationCacheForgetsReleasedCode) {
  ASSERT_EQ(__tracer_register_sub_language_hook(get("full")), 0);
  __tracer_load_pending_sub_language_hooks();
  data_->sub_language_hook = Ref::borrow(get("full"));
  Ref code = Ref::steal(code_of("engine_step"));
  COPathnameTable* table = &gSelf.co_pathname_table;
  ASSERT_EQ(RegisterCOPathname(table, code.get(), "/impl/engine.py", nullptr, 1), 0);
  ASSERT_EQ(table->code_released, &__tracer_sub_language_forget_code);
  bool ran = run_in_frame(ns_.get(), "engine_step", [&](PyFrameObject* frame) {
    auto* f = reinterpret_cast<PyObject*>(frame);
    EXPECT_EQ(__tracer_sub_language_in_impl(data_, f), 7);
    EXPECT_EQ(gSelf.sub_language.impl_cache.num_entries, 1u);
    EXPECT_EQ(__tracer_sub_language_get_frame_category(data_, f), 0);
    table->code_released(code.get());
    EXPECT_EQ(gSelf.sub_language.impl_cache.num_entries, 0u);
    EXPECT_EQ(__tracer_sub_language_in_impl(data_, f), 7);  // computed again
    data_->stop_frame = Ref::borrow(f);
    EXPECT_EQ(__tracer_sub_language_get_action(data_), -1);  // caches engine_step as no key
    data_->stop_frame.reset();
    EXPECT_EQ(gSelf.sub_language.key_cache.num_entries, 1u);
    table->code_released(nullptr);
    EXPECT_EQ(gSelf.sub_language.impl_cache.num_entries, 0u);
    EXPECT_EQ(gSelf.sub_language.key_cache.num_entries, 0u);
    EXPECT_EQ(gSelf.sub_language.enabled, 1);  // the hooks themselves stay
  });
  EXPECT_TRUE(ran);
  data_->sub_language_hook.reset();
}

TEST_F(SubLanguageTest, WithoutAnActiveHookEveryFrameIsUnknown) {
  ASSERT_EQ(__tracer_register_sub_language_hook(get("full")), 0);
  __tracer_load_pending_sub_language_hooks();
  run_in_frame(ns_.get(), "engine_step", [&](PyFrameObject* frame) {
    auto* f = reinterpret_cast<PyObject*>(frame);
    EXPECT_EQ(__tracer_sub_language_get_frame_category(data_, f), -1);
    EXPECT_EQ(__tracer_sub_language_get_frame_category(nullptr, f), -1);
    EXPECT_EQ(__tracer_sub_language_in_impl(data_, f), 0);
  });
}

}  // namespace

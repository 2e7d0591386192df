// Ref: the one owning reference type for Python objects held by C++ code.
//
// Rules (so that ownership is visible at a glance):
//  - A Ref always owns the reference it holds; it releases it when it dies or is reset.
//  - Ref::steal(p) adopts a new reference (the result of a call that returns one);
//    Ref::borrow(p) takes an additional reference to a borrowed pointer.
//  - get() lends the pointer (borrowed for as long as the Ref lives); release() hands the
//    reference over to the caller (for returning a new reference to the interpreter).
//  - There is no implicit conversion to PyObject*: every hand-over is spelled out.
#pragma once

#include <Python.h>

#include <new>
#include <utility>

class Ref {
 public:
  Ref() noexcept = default;
  Ref(const Ref& other) noexcept : obj_(other.obj_) { Py_XINCREF(obj_); }
  Ref(Ref&& other) noexcept : obj_(std::exchange(other.obj_, nullptr)) {}
  ~Ref() { Py_XDECREF(obj_); }

  Ref& operator=(Ref other) noexcept {
    std::swap(obj_, other.obj_);
    return *this;
  }

  // Adopts a new reference (may be null).
  [[nodiscard]] static Ref steal(PyObject* obj) noexcept { return Ref(obj); }
  // Takes a new reference to a borrowed pointer (may be null).
  [[nodiscard]] static Ref borrow(PyObject* obj) noexcept {
    Py_XINCREF(obj);
    return Ref(obj);
  }
  [[nodiscard]] static Ref none() noexcept { return borrow(Py_None); }

  PyObject* get() const noexcept { return obj_; }
  explicit operator bool() const noexcept { return obj_ != nullptr; }
  bool is(const PyObject* other) const noexcept { return obj_ == other; }
  bool is_none() const noexcept { return obj_ == Py_None; }

  // Hands the reference to the caller; the Ref becomes null.
  [[nodiscard]] PyObject* release() noexcept { return std::exchange(obj_, nullptr); }
  // New reference for returning to the interpreter; the Ref keeps its own.
  [[nodiscard]] PyObject* new_ref() const noexcept {
    Py_XINCREF(obj_);
    return obj_;
  }

  // Drops the held reference. The field is detached before the release runs, so a
  // finalizer that looks at the owner sees null, never a dangling pointer.
  void reset() noexcept { Py_XDECREF(std::exchange(obj_, nullptr)); }

  // Forgets the held reference without releasing it. Used only where the owner's contract
  // says an old value is overwritten, not released; every use says why.
  void forget() noexcept { obj_ = nullptr; }

 private:
  explicit Ref(PyObject* obj) noexcept : obj_(obj) {}
  PyObject* obj_ = nullptr;
};

// Keeps a global record alive for the life of the process without running its destructor
// at exit: the interpreter is gone by then, and releasing Python references would crash.
template <typename T>
class NoDestructor {
 public:
  NoDestructor() { new (storage_) T(); }
  T& get() noexcept { return *std::launder(reinterpret_cast<T*>(storage_)); }

 private:
  alignas(T) unsigned char storage_[sizeof(T)];
};

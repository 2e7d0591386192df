// io_methods.cpp: the two methods through which the server side reads the debugged program's
// input: WaitForInput (wait until the program's file or the debug connection can be read,
// without the interpreter lock) and CopyIntoBuffer (copy bytes into a writable buffer at an
// offset).
//
// The "#" formats hand lengths over as Py_ssize_t only with this macro on 3.11 and 3.12;
// later versions always do so and ignore it.
#define PY_SSIZE_T_CLEAN
#include <Python.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <optional>

#include "module/methods.h"
#include "support/dprintf.h"
#include "support/inputwait.h"

namespace {

// The caller's errno is the same after the method as before, whatever the wait did to it.
class ErrnoKept {
 public:
  ErrnoKept() : saved_(errno) {}
  ~ErrnoKept() { errno = saved_; }
  ErrnoKept(const ErrnoKept&) = delete;
  ErrnoKept& operator=(const ErrnoKept&) = delete;

 private:
  int saved_;
};

// Gives a buffer obtained by the argument parser back on every path.
class HeldBuffer {
 public:
  explicit HeldBuffer(Py_buffer* view) : view_(view) {}
  ~HeldBuffer() { PyBuffer_Release(view_); }
  HeldBuffer(const HeldBuffer&) = delete;
  HeldBuffer& operator=(const HeldBuffer&) = delete;

 private:
  Py_buffer* view_;
};

PyObject* unable_to_wait() {
  return PyLong_FromLong(-1);
}

}  // namespace

// The stream is opened on a private duplicate of the file's descriptor and closed again
// before returning: a stream opened on the descriptor itself could never be closed without
// closing the caller's descriptor, and leaving it open leaked one FILE per call. A new
// stream has nothing buffered yet, so its count is 0 and the wait follows; the count is
// still asked for, as the answer's contract says.
PyObject* WrapWaitForInput(PyObject*, PyObject* args) {
  ErrnoKept errno_kept;
  do_dprintf(kDbgFlow, "Entering WrapWaitForInput\n");
  PyObject* file = nullptr;
  PyObject* socket_list = nullptr;
  if (!PyArg_ParseTuple(args, "OO!", &file, &PyList_Type, &socket_list)) return nullptr;
  // Any object with a fileno() method, or an int, gives a descriptor.
  int fd = PyObject_AsFileDescriptor(file);
  if (fd < 0) {
    PyErr_Clear();
    return unable_to_wait();
  }
  PrivateInputStream stream(fd);
  if (stream.get() == nullptr) return unable_to_wait();
  std::optional<long> answer = wait_for_input_on_stream(stream.get(), socket_list);
  if (!answer) return nullptr;
  return PyLong_FromLong(*answer);
}

// The writable buffer comes through the buffer protocol ("w*"; the old "w#" no longer
// exists). An offset outside the buffer would write outside it: refused.
PyObject* WrapCopyIntoBuffer(PyObject*, PyObject* args) {
  Py_buffer target;
  int offset = 0;
  const char* data = nullptr;
  Py_ssize_t data_length = 0;
  if (!PyArg_ParseTuple(args, "w*is#", &target, &offset, &data, &data_length)) return nullptr;
  HeldBuffer held(&target);
  if (offset < 0 || offset > target.len) {
    PyErr_Format(PyExc_ValueError, "offset %d is outside the buffer of %zd bytes", offset,
                 target.len);
    return nullptr;
  }
  Py_ssize_t count = std::min(data_length, target.len - offset);
  std::memmove(static_cast<char*>(target.buf) + offset, data, static_cast<size_t>(count));
  return PyLong_FromSsize_t(count);
}

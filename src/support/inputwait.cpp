// inputwait.cpp: waiting for input on a stream or the debug connection (see inputwait.h).
#include "support/inputwait.h"

#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <new>
#include <optional>

#include "support/dprintf.h"
#include "support/ref.h"

#if !defined(__GLIBC__)
#error "GetFileBufferCount reads glibc's stream fields; port it to this C library first"
#endif

namespace {

// ---- The descriptor array ----------------------------------------------------------------

// The descriptor that item.fileno() gives, or false with a Python error pending.
bool descriptor_of_item(PyObject* item, int index, int* fd) {
  Ref result = Ref::steal(PyObject_CallMethod(item, "fileno", nullptr));
  if (!result) return false;
  if (!PyLong_Check(result.get())) {
    PyErr_Format(PyExc_TypeError, "fileno() of socket_list item %d returned %.200s, not an int",
                 index, Py_TYPE(result.get())->tp_name);
    return false;
  }
  int overflow = 0;
  long value = PyLong_AsLongAndOverflow(result.get(), &overflow);
  if (overflow != 0 || value < INT_MIN || value > INT_MAX) {
    PyErr_Format(PyExc_OverflowError,
                 "fileno() of socket_list item %d returned %R, which is not a descriptor", index,
                 result.get());
    return false;
  }
  *fd = static_cast<int>(value);
  return true;
}

// One slot per item, at least one, the first set to -1; null with MemoryError when they
// cannot be had.
std::unique_ptr<int[]> allocate_slots(Py_ssize_t items, int* slots) {
  std::unique_ptr<int[]> array;
  if (items < INT_MAX) {
    *slots = items > 0 ? static_cast<int>(items) : 1;
    array.reset(new (std::nothrow) int[*slots]);
  }
  if (!array) {
    PyErr_SetString(PyExc_MemoryError, "Out of memory");
    return array;
  }
  array[0] = -1;
  return array;
}

// ---- The wait ----------------------------------------------------------------------------
//
// The wait uses poll() rather than select(): select's descriptor set holds only descriptors
// below FD_SETSIZE (1024), and a program may well have its input or the debugger's socket
// above that. What select() answered is reproduced exactly:
//  - select() counts a descriptor as readable when a read would not block, which includes
//    end of file, a hang-up and a pending error; poll() reports those apart from POLLIN.
//  - select() fails with EBADF when a descriptor is not open, where poll() succeeds and
//    flags that descriptor POLLNVAL; both count as a failed wait here.
//  - after a failed wait the set is left as it was given, so the stream counts as readable
//    (the order of tests below, which a failed wait passes through, is kept as it was).

constexpr short kReadableEvents = POLLIN | POLLHUP | POLLERR;

// Fills `set` with the stream's descriptor first, then the array's non-negative ones.
// Returns how many entries it used.
int fill_read_set(pollfd* set, int fp_fileno, const int* fds, int count) {
  do_dprintf(kDbgInput, "Adding fd %d (fp_fileno) to read_set\n", fp_fileno);
  set[0] = pollfd{fp_fileno, POLLIN, 0};
  int used = 1;
  for (int i = 0; i < count; ++i) {
    if (fds[i] < 0) continue;
    do_dprintf(kDbgInput, "Adding fd %d to read_set\n", fds[i]);
    set[used++] = pollfd{fds[i], POLLIN, 0};
  }
  return used;
}

// poll() with no time limit and without the interpreter lock; errno as poll() left it.
int poll_without_lock(pollfd* set, int used) {
  PyThreadState* released = PyEval_SaveThread();
  int result = poll(set, static_cast<nfds_t>(used), -1);
  int poll_errno = errno;
  PyEval_RestoreThread(released);
  errno = poll_errno;
  return result;
}

bool wait_failed(int poll_result, const pollfd* set, int used) {
  if (poll_result < 0) return true;
  for (int i = 0; i < used; ++i) {
    if ((set[i].revents & POLLNVAL) != 0) return true;
  }
  return false;
}

// Which side a wait that did not answer 0 reports: the stream when its descriptor (entry
// 0) is in the read set select() would have left, else the debug connection.
int readable_side(int poll_result, const pollfd* set, int used) {
  if (wait_failed(poll_result, set, used) || (set[0].revents & kReadableEvents) != 0) {
    do_dprintf(kDbgInput, "File pointer (stdin) is readable\n");
    return kWaitFileReadable;
  }
  do_dprintf(kDbgInput, "Debug connection is readable\n");
  return kWaitSocketReadable;
}

long answer_for(int wait_result) {
  switch (wait_result) {
    case kWaitFileReadable:
      return 1;
    case kWaitSocketReadable:
      return 0;
    default:
      return -1;
  }
}

}  // namespace

FDArray CreateFDArray(PyObject* socket_list) {
  FDArray array;
  if (!PyList_CheckExact(socket_list)) {
    // The interpreter's internal-error text, raised directly: its own call asserts (and so
    // aborts a debug interpreter) or names the source file in the text.
    PyErr_SetString(PyExc_SystemError, "bad argument to internal function");
    return array;
  }
  int slots = 0;
  array.slots = allocate_slots(PyList_GET_SIZE(socket_list), &slots);
  if (!array.slots) return array;
  // fileno() runs Python code, which may shrink or grow the list: read no further than the
  // list now reaches, and no more items than there are slots.
  for (int i = 0; i < slots && i < PyList_GET_SIZE(socket_list); ++i) {
    Ref item = Ref::borrow(PyList_GET_ITEM(socket_list, i));
    if (!descriptor_of_item(item.get(), i, &array.slots[i])) {
      array.slots.reset();
      array.count = 0;
      return array;
    }
    array.count = i + 1;
  }
  return array;
}

long GetFileBufferCount(FILE* stream) {
  // glibc keeps the unread part of the buffer between these two pointers (both null until
  // the first read). After an ungetc() of a different character glibc reads from a backup
  // area first; the count is then that of the backup area alone.
  return stream->_IO_read_end - stream->_IO_read_ptr;
}

int WaitOnStdin(FILE* stream, const int* fds, int count) {
  do_dprintf(kDbgInput, "Starting WaitOnStdin (posix version)\n");
  int fp_fileno = fileno(stream);
  if (fp_fileno < 0) {
    do_dprintf(kDbgInput, "Invalid fp_fileno in WaitOnStdin: %d\n", fp_fileno);
    return kWaitFailed;
  }
  if (count < 0) count = 0;
  // The set is private to this call: filled from the copied array, used without the lock.
  std::unique_ptr<pollfd[]> set(new (std::nothrow) pollfd[static_cast<size_t>(count) + 1]);
  if (!set) return kWaitFailed;
  for (;;) {
    int used = fill_read_set(set.get(), fp_fileno, fds, count);
    do_dprintf(kDbgInput, "Starting select\n");
    int result = poll_without_lock(set.get(), used);
    // A failed wait (-1) goes this way too, and so counts the stream as readable.
    if (result != 0) return readable_side(result, set.get(), used);
    // A wait without a time limit never answers 0; the branch stays for a bounded one.
    if (errno != EINTR) {
      do_dprintf(kDbgInput, "Failure occurred in WaitOnStdin\n");
      return kWaitFailed;
    }
    do_dprintf(kDbgInput, "Select was interrupted; reseting errno to 0");
    errno = 0;
  }
}

std::optional<long> wait_for_input_on_stream(FILE* stream, PyObject* socket_list) {
  long buffered = GetFileBufferCount(stream);
  do_dprintf(kDbgFlow, "Current file buffer count = %d\n", static_cast<int>(buffered));
  if (buffered != 0) return buffered;
  Py_ssize_t length = PyList_Check(socket_list) ? PyList_GET_SIZE(socket_list) : 0;
  do_dprintf(kDbgFlow, "Calling WaitOnStdin(fp = %p, socket_list length = %d\n",
             static_cast<void*>(stream), static_cast<int>(length));
  FDArray fds = CreateFDArray(socket_list);
  if (!fds.slots) return std::nullopt;
  return answer_for(WaitOnStdin(stream, fds.slots.get(), fds.count));
}

PrivateInputStream::PrivateInputStream(int fd) {
  // Close-on-exec, so that a program forking and running another one meanwhile does not
  // hand the copy on.
  int copy = fcntl(fd, F_DUPFD_CLOEXEC, 0);
  if (copy < 0) return;
  // fdopen() checks the access mode: a descriptor that cannot be read gives no stream.
  stream_ = fdopen(copy, "r");
  if (stream_ == nullptr) close(copy);
}

PrivateInputStream::~PrivateInputStream() {
  // The stream never read, so closing it moves no file offset that the caller shares.
  if (stream_ != nullptr) fclose(stream_);
}

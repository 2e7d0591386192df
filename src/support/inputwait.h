// inputwait.h: waiting until the debugged program's input file or one of the debug
// connection's sockets can be read, without holding the interpreter lock while waiting.
//
// The server side calls this (through the module method WaitForInput) before it reads the
// program's standard input on the program's behalf. The wait answers in this order: bytes
// already buffered in the C stream, then whichever of the file and the sockets becomes
// readable first, the file winning when both are.
//
// Everything here is called with the interpreter lock held; WaitOnStdin gives it up only for
// the blocking call itself, so that other threads run meanwhile and the debug messages of
// the wait can still be written.
#pragma once

#include <Python.h>

#include <cstdio>
#include <memory>
#include <optional>

// The descriptors of a socket list, copied out of the list before the wait so that the
// Python list may change (or go away) while the lock is released.
struct FDArray {
  std::unique_ptr<int[]> slots;  // owned; at least one slot; null when building failed
  int count = 0;                 // slots read from the list (0 for an empty list)
};

// Calls fileno() on every item of `socket_list`, which must be exactly a list. Returns an
// array with null `slots` and a Python error pending when an item has no fileno, fileno()
// raises or answers something that is not an int fitting a C int, or memory runs out. An
// empty list gives one slot holding -1. Negative descriptors are kept; the wait skips them.
FDArray CreateFDArray(PyObject* socket_list);

// Bytes read into the stream's buffer and not yet consumed by the program (read from
// glibc's stream fields).
long GetFileBufferCount(FILE* stream);

// What WaitOnStdin answers.
enum WaitOnStdinResult : int {
  kWaitFailed = 1,         // the stream has no descriptor, or the wait could not be set up
  kWaitFileReadable = 2,   // the stream's descriptor is readable (also after a failed wait)
  kWaitSocketReadable = 3  // only a socket of the array is readable
};

// Waits, without a time limit, until the stream's descriptor or one of the first `count`
// descriptors of `fds` can be read. Must be called with the interpreter lock held; releases
// it around the wait only. Prints its progress on the debug channel's input class.
int WaitOnStdin(FILE* stream, const int* fds, int count);

// The answer of WaitForInput for a stream: the count of bytes already buffered in it when
// there are any (at once, without waiting or looking at the list); otherwise, after copying
// the descriptors of `socket_list` (a list) with CreateFDArray, 1 when the file became
// readable, 0 when a socket did, -1 when the wait failed. No value, with the Python error
// pending, when the list could not be read. Called with the interpreter lock held.
std::optional<long> wait_for_input_on_stream(FILE* stream, PyObject* socket_list);

// A C stream for reading, opened on a private duplicate of a caller's descriptor and closed
// (with the duplicate) when this goes away, so that asking about it leaves neither an open
// FILE nor a descriptor behind and never closes the caller's descriptor.
class PrivateInputStream {
 public:
  explicit PrivateInputStream(int fd);
  ~PrivateInputStream();
  PrivateInputStream(const PrivateInputStream&) = delete;
  PrivateInputStream& operator=(const PrivateInputStream&) = delete;

  // Null when the descriptor could not be duplicated or opened for reading (a write-only
  // descriptor, one that is not open).
  FILE* get() const { return stream_; }

 private:
  FILE* stream_ = nullptr;
};

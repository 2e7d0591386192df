// test_inputwait.cpp: the wait for input on a C stream and the debug connection: the count of
// bytes buffered in a stream, answering buffered bytes without waiting, which side the wait
// reports (and what a failed wait reports), releasing the interpreter lock around the wait,
// the descriptor copy of a socket list, and the private stream of the module method.
#include "support/inputwait.h"

#include <dirent.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstring>
#include <optional>
#include <mutex>
#include <set>
#include <string>
#include <thread>

#include "core_test_support.h"
#include "module/methods.h"

namespace {

using coretest::DebugCapture;
using Clock = std::chrono::steady_clock;

// A pipe whose read end is also open as a C stream.
class PipeStream {
 public:
  PipeStream() {
    EXPECT_EQ(pipe(fds_), 0);
    stream_ = fdopen(fds_[0], "r");
    EXPECT_NE(stream_, nullptr);
  }
  ~PipeStream() {
    if (stream_ != nullptr) fclose(stream_);
    close(fds_[1]);
  }
  PipeStream(const PipeStream&) = delete;
  PipeStream& operator=(const PipeStream&) = delete;

  FILE* stream() const { return stream_; }
  int read_fd() const { return fds_[0]; }
  void write_text(const char* text) const {
    ASSERT_EQ(write(fds_[1], text, strlen(text)), static_cast<ssize_t>(strlen(text)));
  }

 private:
  int fds_[2] = {-1, -1};
  FILE* stream_ = nullptr;
};

// A connected pair of sockets: the test waits on `waited()` and writes to the other end.
class SocketPair {
 public:
  SocketPair() { EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds_), 0); }
  ~SocketPair() {
    close(fds_[0]);
    close(fds_[1]);
  }
  SocketPair(const SocketPair&) = delete;
  SocketPair& operator=(const SocketPair&) = delete;

  int waited() const { return fds_[0]; }
  int other_end() const { return fds_[1]; }
  void send_byte() const { ASSERT_EQ(write(fds_[1], "s", 1), 1); }

 private:
  int fds_[2] = {-1, -1};
};

// Writes a byte to a descriptor after `limit` unless stopped first: a wait that should
// have answered at once ends anyway, and the test fails on its duration instead of hanging.
class Watchdog {
 public:
  Watchdog(int fd, std::chrono::seconds limit)
      : thread_([this, fd, limit] {
          std::unique_lock<std::mutex> lock(mutex_);
          if (!cv_.wait_for(lock, limit, [this] { return stopped_; })) {
            EXPECT_EQ(write(fd, "w", 1), 1);
          }
        }) {}
  ~Watchdog() {
    {
      std::lock_guard<std::mutex> lock(mutex_);
      stopped_ = true;
    }
    cv_.notify_all();
    thread_.join();
  }

 private:
  std::mutex mutex_;
  std::condition_variable cv_;
  bool stopped_ = false;
  std::thread thread_;
};

std::set<std::string> open_descriptors() {
  std::set<std::string> names;
  DIR* dir = opendir("/proc/self/fd");
  EXPECT_NE(dir, nullptr);
  if (dir == nullptr) return names;
  int own = dirfd(dir);
  while (dirent* entry = readdir(dir)) {
    std::string name = entry->d_name;
    if (name != "." && name != ".." && name != std::to_string(own)) names.insert(name);
  }
  closedir(dir);
  return names;
}

constexpr const char* kSocketListSource = R"(
class Fd:
    def __init__(self, n):
        self.n = n
    def fileno(self):
        return self.n

def socket_list(*descriptors):
    return [Fd(n) for n in descriptors]

def bad_list():
    return [object()]
)";

class InputWaitTest : public coretest::PythonTest {
 protected:
  void SetUp() override {
    PythonTest::SetUp();
    globals_ = coretest::make_namespace(kSocketListSource);
  }

  // [Fd(n) for n in fds] (new reference).
  Ref socket_list(std::initializer_list<int> fds) {
    Ref args = Ref::steal(PyTuple_New(static_cast<Py_ssize_t>(fds.size())));
    Py_ssize_t i = 0;
    for (int fd : fds) PyTuple_SET_ITEM(args.get(), i++, PyLong_FromLong(fd));
    Ref list = Ref::steal(
        PyObject_Call(coretest::item(globals_.get(), "socket_list"), args.get(), nullptr));
    EXPECT_TRUE(list);
    return list;
  }
  Ref bad_list() {
    Ref list = Ref::steal(PyObject_CallNoArgs(coretest::item(globals_.get(), "bad_list")));
    EXPECT_TRUE(list);
    return list;
  }

  Ref globals_;
};

// ---- GetFileBufferCount ------------------------------------------------------------------

TEST_F(InputWaitTest, BufferCountIsZeroBeforeTheFirstRead) {
  PipeStream pipe;
  pipe.write_text("hello");
  EXPECT_EQ(GetFileBufferCount(pipe.stream()), 0);
}

TEST_F(InputWaitTest, BufferCountIsWhatIsLeftAfterPartialReads) {
  PipeStream pipe;
  pipe.write_text("hello world");
  ASSERT_EQ(fgetc(pipe.stream()), 'h');
  EXPECT_EQ(GetFileBufferCount(pipe.stream()), 10);
  char part[4];
  ASSERT_EQ(fread(part, 1, sizeof part, pipe.stream()), sizeof part);
  EXPECT_EQ(GetFileBufferCount(pipe.stream()), 6);
  ASSERT_EQ(ungetc('o', pipe.stream()), 'o');  // the same byte back: still the buffer
  EXPECT_EQ(GetFileBufferCount(pipe.stream()), 7);
}

TEST_F(InputWaitTest, BufferCountIsZeroOnceEverythingIsRead) {
  PipeStream pipe;
  pipe.write_text("abc");
  char all[3];
  ASSERT_EQ(fread(all, 1, sizeof all, pipe.stream()), sizeof all);
  EXPECT_EQ(GetFileBufferCount(pipe.stream()), 0);
}

// ---- wait_for_input_on_stream ------------------------------------------------------------

TEST_F(InputWaitTest, BufferedBytesAreAnsweredAtOnceWithoutWaiting) {
  PipeStream pipe;  // its write end stays open: the pipe never reaches end of file
  SocketPair idle;  // never written, unless the watchdog has to end a wait
  pipe.write_text("hello");
  ASSERT_EQ(fgetc(pipe.stream()), 'h');  // the pipe is empty now, the stream holds "ello"
  Ref sockets = socket_list({idle.waited()});
  DebugCapture capture(kDbgFlow | kDbgInput);
  const auto start = Clock::now();
  std::optional<long> answer;
  {
    Watchdog watchdog(idle.other_end(), std::chrono::seconds(10));
    answer = wait_for_input_on_stream(pipe.stream(), sockets.get());
  }
  EXPECT_LT(Clock::now() - start, std::chrono::seconds(2));
  ASSERT_TRUE(answer.has_value());
  EXPECT_EQ(*answer, 4);
  EXPECT_EQ(capture.text(), "Current file buffer count = 4\n");
  EXPECT_EQ(GetFileBufferCount(pipe.stream()), 4);  // nothing was consumed
}

TEST_F(InputWaitTest, BufferedBytesAreAnsweredBeforeTheListIsRead) {
  PipeStream pipe;
  pipe.write_text("xy");
  ASSERT_EQ(fgetc(pipe.stream()), 'x');
  Ref items = bad_list();  // fileno() would raise AttributeError
  std::optional<long> answer = wait_for_input_on_stream(pipe.stream(), items.get());
  ASSERT_TRUE(answer.has_value());
  EXPECT_EQ(*answer, 1);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

TEST_F(InputWaitTest, WithNothingBufferedTheWaitAnswersWhichSideIsReadable) {
  PipeStream pipe;
  SocketPair connection;
  Ref sockets = socket_list({connection.waited()});
  connection.send_byte();
  EXPECT_EQ(wait_for_input_on_stream(pipe.stream(), sockets.get()), 0);
  pipe.write_text("f");
  EXPECT_EQ(wait_for_input_on_stream(pipe.stream(), sockets.get()), 1);
}

TEST_F(InputWaitTest, AListThatCannotBeReadIsAPythonError) {
  PipeStream pipe;
  pipe.write_text("f");
  Ref items = bad_list();
  EXPECT_FALSE(wait_for_input_on_stream(pipe.stream(), items.get()).has_value());
  EXPECT_TRUE(PyErr_ExceptionMatches(PyExc_AttributeError));
  PyErr_Clear();
}

TEST_F(InputWaitTest, AStreamWithoutADescriptorCannotBeWaitedOn) {
  char text[] = "";
  FILE* memory = fmemopen(text, 1, "r");
  ASSERT_NE(memory, nullptr);
  Ref sockets = socket_list({});
  EXPECT_EQ(wait_for_input_on_stream(memory, sockets.get()), -1);
  fclose(memory);
}

// ---- WaitOnStdin -------------------------------------------------------------------------

TEST_F(InputWaitTest, TheFileWinsWhenBothAreReadable) {
  PipeStream pipe;
  SocketPair connection;
  pipe.write_text("f");
  connection.send_byte();
  const int fds[] = {connection.waited()};
  EXPECT_EQ(WaitOnStdin(pipe.stream(), fds, 1), kWaitFileReadable);
}

TEST_F(InputWaitTest, OnlyASocketReadableAnswersThree) {
  PipeStream pipe;
  SocketPair quiet, connection;
  connection.send_byte();
  const int fds[] = {-1, quiet.waited(), connection.waited()};
  DebugCapture capture(kDbgInput);
  EXPECT_EQ(WaitOnStdin(pipe.stream(), fds, 3), kWaitSocketReadable);
  const std::string stream_fd = std::to_string(fileno(pipe.stream()));
  EXPECT_EQ(capture.text(),
            "Starting WaitOnStdin (posix version)\n"
            "Adding fd " +
                stream_fd +
                " (fp_fileno) to read_set\n"
                "Adding fd " +
                std::to_string(quiet.waited()) +
                " to read_set\n"
                "Adding fd " +
                std::to_string(connection.waited()) +
                " to read_set\n"
                "Starting select\n"
                "Debug connection is readable\n");
}

TEST_F(InputWaitTest, AnEmptyArrayWaitsOnTheFileAlone) {
  PipeStream pipe;
  const int unused_slot[] = {-1};
  std::thread writer([&pipe] {
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    pipe.write_text("late");
  });
  EXPECT_EQ(WaitOnStdin(pipe.stream(), unused_slot, 0), kWaitFileReadable);
  writer.join();
}

TEST_F(InputWaitTest, EndOfFileCountsAsReadable) {
  int fds[2];
  ASSERT_EQ(pipe(fds), 0);
  FILE* stream = fdopen(fds[0], "r");
  ASSERT_NE(stream, nullptr);
  close(fds[1]);
  const int none[] = {-1};
  EXPECT_EQ(WaitOnStdin(stream, none, 1), kWaitFileReadable);
  fclose(stream);
}

TEST_F(InputWaitTest, ADescriptorThatIsNotOpenFailsTheWaitAndTheFileCounts) {
  PipeStream pipe;  // nothing written
  SocketPair connection;
  connection.send_byte();
  int not_open = dup(connection.waited());
  ASSERT_GE(not_open, 0);
  close(not_open);
  const int fds[] = {connection.waited(), not_open};
  EXPECT_EQ(WaitOnStdin(pipe.stream(), fds, 2), kWaitFileReadable);
}

TEST_F(InputWaitTest, AStreamWithoutADescriptorIsReportedAsAFailure) {
  char text[] = "abc";
  FILE* memory = fmemopen(text, 3, "r");
  ASSERT_NE(memory, nullptr);
  const int none[] = {-1};
  DebugCapture capture(kDbgInput);
  EXPECT_EQ(WaitOnStdin(memory, none, 0), kWaitFailed);
  EXPECT_EQ(capture.text(),
            "Starting WaitOnStdin (posix version)\n"
            "Invalid fp_fileno in WaitOnStdin: -1\n");
  fclose(memory);
}

TEST_F(InputWaitTest, TheInterpreterLockIsFreeDuringTheWait) {
  PipeStream pipe;
  const int none[] = {-1};
  bool ran_python = false;
  // The writer needs the interpreter lock before it writes: the wait can only end if the
  // lock was given up meanwhile.
  std::thread writer([&] {
    PyGILState_STATE state = PyGILState_Ensure();
    {
      Ref result = Ref::steal(
          PyRun_String("sum(range(1000))", Py_eval_input, globals_.get(), globals_.get()));
      ran_python = result && PyLong_AsLong(result.get()) == 499500;
    }
    PyGILState_Release(state);
    pipe.write_text("x");
  });
  EXPECT_EQ(WaitOnStdin(pipe.stream(), none, 0), kWaitFileReadable);
  writer.join();
  EXPECT_TRUE(ran_python);
}

// ---- CreateFDArray -------------------------------------------------------------------------

TEST_F(InputWaitTest, AnEmptyListGivesOneUnusedSlot) {
  Ref empty = Ref::steal(PyList_New(0));
  FDArray array = CreateFDArray(empty.get());
  ASSERT_TRUE(array.slots);
  EXPECT_EQ(array.count, 0);
  EXPECT_EQ(array.slots[0], -1);
}

TEST_F(InputWaitTest, ItemsGiveTheirDescriptorsNegativeOnesIncluded) {
  Ref sockets = socket_list({7, -1, 1500});
  FDArray array = CreateFDArray(sockets.get());
  ASSERT_TRUE(array.slots);
  ASSERT_EQ(array.count, 3);
  EXPECT_EQ(array.slots[0], 7);
  EXPECT_EQ(array.slots[1], -1);
  EXPECT_EQ(array.slots[2], 1500);
}

TEST_F(InputWaitTest, NotExactlyAListIsAnInternalError) {
  Ref tuple = Ref::steal(PyTuple_New(0));
  FDArray array = CreateFDArray(tuple.get());
  EXPECT_FALSE(array.slots);
  EXPECT_TRUE(PyErr_ExceptionMatches(PyExc_SystemError));
  PyErr_Clear();
}

TEST_F(InputWaitTest, AFilenoThatIsNotAnIntIsATypeError) {
  Ref items =
      Ref::steal(PyRun_String("[Fd(3), Fd('4')]", Py_eval_input, globals_.get(), globals_.get()));
  ASSERT_TRUE(items);
  FDArray array = CreateFDArray(items.get());
  EXPECT_FALSE(array.slots);
  Ref error = coretest::take_pending_exception();
  ASSERT_TRUE(error);
  EXPECT_TRUE(PyErr_GivenExceptionMatches(error.get(), PyExc_TypeError));
  Ref text = Ref::steal(PyObject_Str(error.get()));
  EXPECT_STREQ(PyUnicode_AsUTF8(text.get()),
               "fileno() of socket_list item 1 returned str, not an int");
}

// ---- The private stream and the method ---------------------------------------------------

TEST_F(InputWaitTest, PrivateStreamLeavesNothingOpenAndTheCallersDescriptorUsable) {
  PipeStream pipe;
  const std::set<std::string> before = open_descriptors();
  for (int i = 0; i < 1000; ++i) {
    PrivateInputStream stream(pipe.read_fd());
    ASSERT_NE(stream.get(), nullptr);
    EXPECT_NE(fileno(stream.get()), pipe.read_fd());
  }
  EXPECT_EQ(open_descriptors(), before);
  pipe.write_text("still open");
  char text[10];
  EXPECT_EQ(read(pipe.read_fd(), text, sizeof text), 10);
}

TEST_F(InputWaitTest, PrivateStreamOfAWriteOnlyDescriptorIsNull) {
  int fds[2];
  ASSERT_EQ(pipe(fds), 0);
  const std::set<std::string> before = open_descriptors();
  {
    PrivateInputStream stream(fds[1]);
    EXPECT_EQ(stream.get(), nullptr);
  }
  EXPECT_EQ(open_descriptors(), before);
  EXPECT_EQ(write(fds[1], "x", 1), 1);  // still the caller's, still open
  close(fds[0]);
  close(fds[1]);
}

TEST_F(InputWaitTest, TheMethodKeepsErrno) {
  PipeStream pipe;
  pipe.write_text("f");
  int write_only[2];
  ASSERT_EQ(::pipe(write_only), 0);
  for (int fd : {pipe.read_fd(), write_only[1], -1}) {
    Ref args = Ref::steal(Py_BuildValue("(i[])", fd));
    errno = coretest::kMarkerErrno;
    Ref answer = Ref::steal(WrapWaitForInput(nullptr, args.get()));
    EXPECT_EQ(errno, coretest::kMarkerErrno) << fd;
    ASSERT_TRUE(answer) << fd;
    EXPECT_EQ(PyLong_AsLong(answer.get()), fd == pipe.read_fd() ? 1 : -1);
  }
  EXPECT_EQ(PyErr_Occurred(), nullptr);
  close(write_only[0]);
  close(write_only[1]);
}

}  // namespace

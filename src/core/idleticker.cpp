// idleticker.cpp: the idle ticker (see idleticker.h).
#include "core/idleticker.h"

#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <mutex>
#include <thread>

#include "core/monitoring.h"
#include "core/tracercore.h"
#include "support/dbgcommon.h"
#include "support/dprintf.h"
#include "support/pycompat.h"

namespace {

constexpr auto kTickInterval = std::chrono::milliseconds(500);

// One ticker thread per process at most, made when ticks become wanted; it ends when they
// are not any more, before a fork (a native thread would make os.fork warn that the process
// is multi-threaded) and at exit. An ended thread is joined by whoever needs the record next
// (it holds no lock by then: the join is immediate). The interpreter's threads change the
// record with the interpreter lock held and take `lock` after it; the ticker never holds
// `lock` while it takes or holds the interpreter lock, so the two cannot wait on each other.
struct Ticker {
  std::mutex lock;
  std::condition_variable wake;
  bool wanted = false;   // the tracer's state asks for ticks
  bool quit = false;     // the thread is to end (set while one of ours waits for it)
  bool running = false;  // the thread has not decided to end
  bool exiting = false;  // the interpreter is shutting down: no thread starts any more
  std::thread thread;
  pid_t pid = getpid();  // the process the thread belongs to
};

// Never freed (a joinable thread object must not be destroyed).
Ticker* gTicker = new Ticker;

bool gResumeAfterFork = false;  // read and written with the interpreter lock held

// The record of this process. A child forked without the fork hooks (from C) has none of its
// parent's threads, and the record's lock may be held by one that is gone there: the child
// leaves it behind.
Ticker* this_process_ticker() {
  if (gTicker->pid != getpid()) gTicker = new Ticker;
  return gTicker;
}

bool ticks_wanted() {
  return gSelf.event_source == kEventsFromMonitoring && gSelf.trace_started &&
         gSelf.idle_period > 0 && !gSelf.in_forked_child;
}

// With the interpreter lock: the next traced event reads the clock, and the places that went
// quiet come back so that there is a next event. The tracer's own state, read under that
// lock, says whether ticks are still wanted (the ticker's flags only follow it).
void tick() {
  PyGILState_STATE gil = PyGILState_Ensure();
  if (ticks_wanted()) {
    gSelf.idle_tick = gSelf.idle_tick_limit;
    monitoring_lines_needed();
  }
  PyGILState_Release(gil);
}

void run_ticker(Ticker* t) {
  std::unique_lock hold(t->lock);
  while (true) {
    t->wake.wait_for(hold, kTickInterval, [&] { return t->quit || !t->wanted; });
    // Deciding to end and saying so is one step under the lock: a start that comes after it
    // makes a new thread, one before it finds this one running.
    if (t->quit || !t->wanted) break;
    hold.unlock();
    tick();
    hold.lock();
  }
  t->running = false;
}

// Ends the thread and waits for it, without the interpreter lock (the thread may be waiting
// for it). Called with the interpreter lock held.
void end_thread(Ticker* t) {
  {
    std::lock_guard hold(t->lock);
    // Another thread ending it (two forks at once) waits for it alone.
    if (!t->thread.joinable() || t->quit) return;
    t->quit = true;  // a thread that has ended already is only joined
  }
  t->wake.notify_all();
  Py_BEGIN_ALLOW_THREADS;
  t->thread.join();
  Py_END_ALLOW_THREADS;
  std::lock_guard hold(t->lock);
  t->quit = false;
}

PyObject* end_at_exit(PyObject*, PyObject*) {
  Ticker* t = this_process_ticker();
  {
    std::lock_guard hold(t->lock);
    t->exiting = true;
  }
  end_thread(t);
  Py_RETURN_NONE;
}

PyObject* end_before_fork(PyObject*, PyObject*) {
  end_thread(this_process_ticker());
  Py_RETURN_NONE;
}

PyObject* resume_after_fork(PyObject*, PyObject*) {
  gResumeAfterFork = true;
  monitoring_lines_needed();  // there must be a next event
  Py_RETURN_NONE;
}

PyMethodDef gEndAtExitDef = {"_end_idle_ticker", end_at_exit, METH_NOARGS, nullptr};
PyMethodDef gBeforeForkDef = {"_end_idle_ticker_before_fork", end_before_fork, METH_NOARGS,
                              nullptr};
PyMethodDef gAfterForkDef = {"_resume_idle_ticker_after_fork", resume_after_fork, METH_NOARGS,
                             nullptr};

bool register_hooks() {
  Ref at_exit = Ref::steal(PyCFunction_New(&gEndAtExitDef, nullptr));
  Ref before = Ref::steal(PyCFunction_New(&gBeforeForkDef, nullptr));
  Ref after = Ref::steal(PyCFunction_New(&gAfterForkDef, nullptr));
  if (!at_exit || !before || !after) return false;
  Ref atexit = Ref::steal(PyImport_ImportModule("atexit"));
  if (!atexit) return false;
  Ref done = Ref::steal(PyObject_CallMethod(atexit.get(), "register", "O", at_exit.get()));
  if (!done) return false;
  Ref os = Ref::steal(PyImport_ImportModule("os"));
  Ref hook = os ? Ref::steal(PyObject_GetAttrString(os.get(), "register_at_fork")) : Ref();
  if (!hook) return false;
  Ref kwargs =
      Ref::steal(Py_BuildValue("{sOsO}", "before", before.get(), "after_in_parent", after.get()));
  Ref no_args = Ref::steal(PyTuple_New(0));
  if (!kwargs || !no_args) return false;
  done = Ref::steal(PyObject_Call(hook.get(), no_args.get(), kwargs.get()));
  return static_cast<bool>(done);
}

}  // namespace

void idle_ticker_update() {
  Ticker* t = this_process_ticker();
  bool want = ticks_wanted();
  {
    std::lock_guard hold(t->lock);
    t->wanted = want;
    if (want && !t->running && !t->exiting && !t->quit) {
      if (t->thread.joinable()) t->thread.join();  // it has ended: nothing to wait for
      try {
        t->thread = std::thread(run_ticker, t);
        t->running = true;
      } catch (const std::exception&) {
        do_dprintf(kDbgFlow, "IDLE TICKER NOT STARTED\n");
      }
    }
  }
  t->wake.notify_all();
}

void idle_ticker_resume_after_fork() {
  if (!gResumeAfterFork) return;
  gResumeAfterFork = false;
  idle_ticker_update();
}

void init_idle_ticker() {
  compat::PendingError saved;
  saved.fetch();
  if (!register_hooks()) {
    DLOGEXCEPTION();
    PyErr_Clear();
  }
  saved.restore();
}

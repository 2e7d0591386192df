/* _null_tracer.c: the floor for a C trace function, for the benchmarks in bench/.
 *
 * install() makes a trace function that returns 0 at once the calling thread's C trace
 * function: whatever a real tracer costs above this is its own work, the rest is what the
 * interpreter charges for calling a trace function at all. Two variants help to read the
 * numbers: install_locked() takes and releases one interpreter thread lock per event (the
 * price of serialising entry with a mutex), and install_counting() counts the events it sees
 * by kind, so that a benchmark can report a cost per event.
 *
 * callgrind_clock() is a clock for runs under valgrind's callgrind: each call also switches
 * callgrind's collection on or off, so that a pair of calls around a workload counts the
 * instructions of that span only. It is a C function, so trace functions see no event for
 * it. */
#define PY_SSIZE_T_CLEAN
#include <Python.h>
#include <pythread.h>
#include <string.h>
#include <time.h>

#if defined(__has_include)
#if __has_include(<valgrind/callgrind.h>)
#include <valgrind/callgrind.h>
#define HAVE_CALLGRIND 1
#endif
#endif

/* Event counts by kind: call, exception, line, return, and anything else. */
static unsigned long long event_counts[5];
static PyThread_type_lock event_lock = NULL;

static int null_trace(PyObject* obj, PyFrameObject* frame, int what, PyObject* arg) {
  (void)obj;
  (void)frame;
  (void)what;
  (void)arg;
  return 0;
}

static int locked_trace(PyObject* obj, PyFrameObject* frame, int what, PyObject* arg) {
  (void)obj;
  (void)frame;
  (void)what;
  (void)arg;
  /* Uncontended: the lock is always free here, as a debugger's mutex is while one thread
   * runs. */
  if (PyThread_acquire_lock(event_lock, NOWAIT_LOCK)) PyThread_release_lock(event_lock);
  return 0;
}

static int counting_trace(PyObject* obj, PyFrameObject* frame, int what, PyObject* arg) {
  (void)obj;
  (void)frame;
  (void)arg;
  event_counts[what >= 0 && what <= PyTrace_RETURN ? what : 4]++;
  return 0;
}

static PyObject* set_trace(Py_tracefunc func) {
  PyEval_SetTrace(func, NULL);
  /* 3.12 and later report a failing audit hook through the error indicator. */
  if (PyErr_Occurred() != NULL) return NULL;
  Py_RETURN_NONE;
}

static PyObject* install(PyObject* self, PyObject* unused) {
  (void)self;
  (void)unused;
  return set_trace(null_trace);
}

static PyObject* install_locked(PyObject* self, PyObject* unused) {
  (void)self;
  (void)unused;
  if (event_lock == NULL) {
    event_lock = PyThread_allocate_lock();
    if (event_lock == NULL) return PyErr_NoMemory();
  }
  return set_trace(locked_trace);
}

static PyObject* install_counting(PyObject* self, PyObject* unused) {
  (void)self;
  (void)unused;
  memset(event_counts, 0, sizeof(event_counts));
  return set_trace(counting_trace);
}

static PyObject* uninstall(PyObject* self, PyObject* unused) {
  (void)self;
  (void)unused;
  return set_trace(NULL);
}

static PyObject* counts(PyObject* self, PyObject* unused) {
  (void)self;
  (void)unused;
  return Py_BuildValue("{sKsKsKsKsK}", "call", event_counts[PyTrace_CALL], "exception",
                       event_counts[PyTrace_EXCEPTION], "line", event_counts[PyTrace_LINE],
                       "return", event_counts[PyTrace_RETURN], "other", event_counts[4]);
}

static PyObject* callgrind_clock(PyObject* self, PyObject* unused) {
  (void)self;
  (void)unused;
#ifdef HAVE_CALLGRIND
  CALLGRIND_TOGGLE_COLLECT;
#endif
  struct timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  return PyFloat_FromDouble((double)now.tv_sec + (double)now.tv_nsec * 1e-9);
}

static PyMethodDef null_tracer_methods[] = {
    {"install", install, METH_NOARGS,
     "Make a trace function that does nothing the calling thread's C trace function."},
    {"install_locked", install_locked, METH_NOARGS,
     "Like install(), but take and release one thread lock per event."},
    {"install_counting", install_counting, METH_NOARGS,
     "Like install(), but count the events by kind (see counts())."},
    {"uninstall", uninstall, METH_NOARGS, "Remove the calling thread's C trace function."},
    {"counts", counts, METH_NOARGS, "Events seen since install_counting(), by kind."},
    {"callgrind_clock", callgrind_clock, METH_NOARGS,
     "Seconds of a monotonic clock; also toggles callgrind's collection."},
    {NULL, NULL, 0, NULL},
};

static struct PyModuleDef null_tracer_module = {
    PyModuleDef_HEAD_INIT,
    .m_name = "_null_tracer",
    .m_doc = "The floor for a C trace function.",
    .m_size = -1,
    .m_methods = null_tracer_methods,
};

PyMODINIT_FUNC PyInit__null_tracer(void) {
  PyObject* module = PyModule_Create(&null_tracer_module);
#ifdef HAVE_CALLGRIND
  int has_callgrind = 1;
#else
  int has_callgrind = 0;
#endif
  if (module != NULL && PyModule_AddIntConstant(module, "HAS_CALLGRIND", has_callgrind) != 0) {
    Py_CLEAR(module);
  }
  return module;
}

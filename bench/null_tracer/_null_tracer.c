/* _null_tracer.c: the floor for a C trace function, for the benchmarks in bench/.
 *
 * install() makes a trace function that returns 0 at once the calling thread's C trace
 * function: whatever a real tracer costs above this is its own work, the rest is what the
 * interpreter charges for calling a trace function at all. Two variants help to read the
 * numbers: install_locked() takes and releases one interpreter thread lock per event (the
 * price of serialising entry with a mutex), and install_counting() counts the events it sees
 * by kind, so that a benchmark can report a cost per event. */
#define PY_SSIZE_T_CLEAN
#include <Python.h>
#include <pythread.h>
#include <string.h>

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

static PyMethodDef null_tracer_methods[] = {
    {"install", install, METH_NOARGS,
     "Make a trace function that does nothing the calling thread's C trace function."},
    {"install_locked", install_locked, METH_NOARGS,
     "Like install(), but take and release one thread lock per event."},
    {"install_counting", install_counting, METH_NOARGS,
     "Like install(), but count the events by kind (see counts())."},
    {"uninstall", uninstall, METH_NOARGS, "Remove the calling thread's C trace function."},
    {"counts", counts, METH_NOARGS, "Events seen since install_counting(), by kind."},
    {NULL, NULL, 0, NULL},
};

static struct PyModuleDef null_tracer_module = {
    PyModuleDef_HEAD_INIT,
    .m_name = "_null_tracer",
    .m_doc = "The floor for a C trace function.",
    .m_size = -1,
    .m_methods = null_tracer_methods,
};

PyMODINIT_FUNC PyInit__null_tracer(void) { return PyModule_Create(&null_tracer_module); }

// threadops.h: the table of per-thread debugger records, thread identity and the thread
// mutex.
//
// One ThreadData per interpreter thread the core has seen, keyed by the thread-state
// pointer's bytes. The interpreter reuses thread-state memory for later threads, so a
// record found by pointer may belong to an earlier thread until it is removed; the thread
// start hook removes such a stale record first.
//
// Records are pinned while code holds them across anything that may run Python code or
// wait for the selvane mutex: above all every event being dispatched, whose thread may wait
// while another thread resets or re-initialises the core. A pinned record is never freed:
// removing it (reset, init, a thread's exit) gives it the state of a new record in place, so
// a pointer held by a waiting thread stays valid and sees the fresh session.
#pragma once

#include <Python.h>
#include <pythread.h>

#include <cstdint>

#include "support/hashtable.h"
#include "support/ref.h"

struct ThreadData {
  int32_t tracer_in_frames = 0;  // 1 once the tracer was put into the thread's frames
  int32_t global_trace_set = 0;  // 1 while the thread's C trace function is ours
  // With sys.monitoring, events reach every thread: 1 while this thread's tracing is
  // switched off (as a failed callback does), the counterpart of removing its trace function.
  int32_t events_off = 0;
  // With sys.monitoring: whether a thread that threading started has reached its run()
  // (-1 not known yet, 0 not yet, 1 yes). The trace function sees such a thread from run()
  // on, where the thread start hook fires; sys.monitoring reports the thread machinery's own
  // frames before it, which are passed over.
  int32_t run_reached = -1;
  PyThreadState* tstate;          // the key; borrowed, never dereferenced after the thread ends
  unsigned long thread_id;        // the thread's identity, refreshed on every lookup
  Ref thread_name;                // owned: name of the thread's main function, or None
  Ref bot_frame;                  // owned: bottom frame of the debugged code, or None
  Ref stop_frame;                 // owned: null runs freely, None stops anywhere, a frame
  Ref step_out_frame;             // owned: frame a step-out leaves, or None
  Ref curr_frame;                 // owned: frame of the latest event, None outside the core
  int32_t line_range_start = -1;  // first line of a stepped-over range, -1 for none
  int32_t line_range_end = -1;    // last line of that range, -1 for none
  Ref sub_language_frame;         // owned or null: frame where the sub-language was entered
  Ref sub_language_hook;          // owned or null: the active sub-language hook object
  int32_t leaving_bot_frame = 0;  // 1 once an exception left the bottom frame
  Ref pending_exception;          // owned or null: exception to raise at the next event
  // The event this thread is dispatching right now, or null (owned by the dispatcher's
  // stack frame): how the dispatcher's helpers learn whether the thread holds the selvane
  // mutex for it yet.
  struct DispatchEvent* dispatch_event = nullptr;
  // Borrowed, only compared: the frame of the thread's latest event if that was an
  // exception event (tells a frame left by an exception where the interpreter does not).
  PyFrameObject* last_exception_frame = nullptr;
  // Borrowed, only compared (holding them would change the program's reference counts): the
  // exception the thread last stopped on because nothing would catch it, the frame of that
  // stop and its code. The outer frames it then passes through report it again; it is
  // stopped on once.
  const void* unhandled_stop_exc = nullptr;
  const void* unhandled_stop_frame = nullptr;
  const void* unhandled_stop_code = nullptr;
  // Borrowed, only compared: the frame an exception is leaving while a stop is made there
  // (its handlers had their turn; its value stack is gone).
  const void* exception_leaving_frame = nullptr;
  // Borrowed, only compared: the frame whose latest exception event found that only a `with`
  // exit might end the exception; it decides again when the exception leaves it.
  const void* with_may_suppress_in = nullptr;
  // How many holders pin this record (see above); only the pinning code changes it.
  int32_t pins = 0;
};

// Pins a record for the life of the object (null is allowed and pins nothing).
class PinnedThreadData {
 public:
  explicit PinnedThreadData(ThreadData* data) noexcept : data_(data) {
    if (data_ != nullptr) ++data_->pins;
  }
  ~PinnedThreadData() {
    if (data_ != nullptr) --data_->pins;
  }
  PinnedThreadData(const PinnedThreadData&) = delete;
  PinnedThreadData& operator=(const PinnedThreadData&) = delete;

 private:
  ThreadData* data_;
};

// The record of the calling thread, created when missing (null with MemoryError set when it
// cannot be). Answered from a per-thread cache on the hot path; any removal from the table
// invalidates every cache.
ThreadData* current_thread_data_or_insert(CU_HashTable* table);
// The same for a given thread state (the dispatcher already has the calling thread's).
ThreadData* thread_data_for(CU_HashTable* table, PyThreadState* tstate);

// The interpreter's thread-identity function, found at load, or null.
extern unsigned long (*gGetThreadIdentFunc)(void);

void init_threadops();
unsigned long get_thread_ident();

PyThread_type_lock allocate_thread_mutex();
int acquire_thread_mutex(PyThread_type_lock lock, int wait);
void release_thread_mutex(PyThread_type_lock lock);

ThreadData* new_thread_data(PyThreadState* tstate);
void free_thread_data(ThreadData* data);

void init_thread_table(CU_HashTable* table);
ThreadData* insert_thread_data(CU_HashTable* table, PyThreadState* tstate);
ThreadData* find_thread_data(CU_HashTable* table, PyThreadState* tstate);
// Both free unpinned records and renew pinned ones in place (they stay in the table).
void remove_thread_data(CU_HashTable* table, PyThreadState* tstate);
void clear_thread_table(CU_HashTable* table);
// Gives a record the state of a new one, keeping what ties it to its thread and to the
// events in flight (thread state, identity, current frame, dispatch event, pins).
void renew_thread_data(ThreadData* data);
// In a forked child only the forking thread exists: the events that other threads had in
// flight will never end, so their pins are dropped and their records can go.
void drop_pins_of_vanished_threads(CU_HashTable* table, PyThreadState* survivor);
ThreadData* get_current_thread_data(CU_HashTable* table);

// Thread ids seen by Python code are the thread-state pointers as ints; they round-trip.
PyObject* id_for_tstate_ptr(PyThreadState* tstate);
// Null with an error pending when `id` is not an int.
PyThreadState* tstate_ptr_for_id(PyObject* id);

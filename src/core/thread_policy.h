// thread_policy.h: which thread may enter the debugger.
//
// The selvane mutex admits one thread at a time into the dispatcher and the debug server;
// its owner is how the dispatcher ignores the debugger's own events and, when only one
// thread is debugged at a time, every other thread. The per-thread policy asks the
// optional debug_thread_cb once per thread and caches the answer until the thread leaves its
// bottom frame.
#pragma once

int acquire_selvane_mutex();
void release_selvane_mutex();
int __should_debug_thread(unsigned long identity);
void __clear_should_debug_thread_cache(unsigned long identity);

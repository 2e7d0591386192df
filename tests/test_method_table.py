"""The module's method table: every method, in its documented order, with its docstring,
and how each is called (keywords only for __import__, which has no docstring but the
interpreter's signature).

The table is part of the contract with the server side: a server written against it finds
each method by name and reads its documentation as it stands, including the docstring that
is_internal_frame deliberately shares with get_thread_ident_for_tstate_id.
"""

import types

import tvantrel30pydebugstackless as core

METHODS = [
    ('init', 'initialise the core; must come first'),
    ('reset', 'reset the core to its blank initial state'),
    ('destroy', 'clear all state and restore the environment'),
    ('set_autoquit', '0 keeps the debug connection when the bottom frame is left (embedded scripting)'),
    ('set_idle_period', 'seconds between idle callbacks'),
    ('set_debug_all_threads', '1 debug all threads; 0 only one thread at a time, ignoring the others while one is stopped'),
    ('set_debug_thread_cb', 'per-thread decision callback (0 ignore, 1 stop with the others, 2 stop only at breakpoint or exception)'),
    ('start_trace', 'install the trace function globally and in all frames'),
    ('stop_trace', 'remove the trace function, stop debugging'),
    ('step_into', 'step into the next function or to the next instruction'),
    ('step_over', 'step over the next instruction'),
    ('step_over_line', 'step over the current line'),
    ('step_over_line_range', 'step over the given range of lines'),
    ('step_out', 'step out of the current frame'),
    ('continue_run', 'run freely to the next breakpoint'),
    ('stop', 'stop at the next reached location'),
    ('get_threads', 'ids of all threads known to the core'),
    ('get_curr_frame', 'the frame where the thread stopped'),
    ('get_thread_name', "name of the thread's main function"),
    ('is_botframe', 'whether the frame is the bottom frame of the calling thread'),
    ('get_tracing', 'whether tracing is active in any thread'),
    ('set_break', 'Set a breakpoint at given file/line.  Pass in file, line, enabled flag,\ntemporary flag, conditional as string (or None), and ignore count.  If\na breakpoint exists, its values will be updated accordingly.  The new breakpoint\nid is returned as int.'),
    ('clear_breaks', 'Clear all breakpoints at given file/line'),
    ('enable_breaks', 'Enable/disable all breakpoints at given file and line number'),
    ('ignore_breaks', 'Ignore all breakpoints at given file and line number for a given number\nof hits'),
    ('set_breaks_cond', 'Set conditional for all breakpoints at given file and line number; empty string to set no conditional'),
    ('clear_all_breaks', 'Clear all defined breakpoints'),
    ('get_breaks', 'Get all breakpoints at given file and line number: Returns sequence of\n(id, enabled, temporary, cond, ignore_count, hit_count) tuples'),
    ('get_file_breaks', 'Get all breakpoints in given file: Returns sequence of (lineno, id\nenabled, temporary, cond, ignore_count, hit_count) tuples'),
    ('set_exception_mode', 'Set exception mode to use : One of kExcNeverStop=0 to never stop\non exceptions, kExcAlwaysStop=1 to always stop on exceptions,\nor kExcUnhandledStop=2 to only stop on unhandled exceptions.\n'),
    ('get_exception_mode', 'Get exception mode in use : One of kExcNeverStop=0 to never stop\non exceptions, kExcAlwaysStop=1 to always stop on exceptions,\nor kExcUnhandledStop=2 to only stop on unhandled exceptions.\n'),
    ('ignore_exception_loc', 'Ignore/un-ignore future exceptions at given file, lineno (filename must be as given\nin the reported exception)'),
    ('exception_loc_ignored', 'Check whether exceptions at given file / line number are being ignored bythe debugger'),
    ('clear_exception_ignores', 'Clear exception ignores list to blank'),
    ('exiting_on_exception', "Returns true when the debugger core has seen an unhandled exception at the\nbottom frame, and thus any further stepping, etc, will cause the program\nto exit.  This is used to make sure we close the client connection cleanly\nin all cases.  Note that this always returns false when autoquit is off\nsince the exception won't cause exit in an embedded environment."),
    ('set_always_stop_excepts', 'Set the tuple of exception types to always stop on'),
    ('get_always_stop_excepts', 'Get the tuple of exception types to always stop on'),
    ('set_never_stop_excepts', 'Set the tuple of exception types to never stop on'),
    ('get_never_stop_excepts', 'Get the tuple of exception types to never stop on'),
    ('set_ignored_exception_handlers', 'Sets the dictionary of ignored handlers.  Keys may be either frame or code objects to ignore'),
    ('set_exc_catch_info_list', 'Set list of exception info instances.  Each instance should have co_name, module_name, prints, ignore, & parent attributes.  Class for these instances is defined in selvane.py.'),
    ('get_new_imports', 'Used to obtain list of full path names for modules that have been\nloaded or reloaded since the last call to this function.  Also clears\nthe table of new loaded/reloaded modules to blank.'),
    ('set_import_cb', 'Set the callback called when a module is imported (may be None)'),
    ('register_module', 'Register module with the debugger'),
    ('register_sub_language_hook', 'Register a sub-language extension with the debugger'),
    ('sub_language_get_active_hook', "Get the active sub language hook in the given thread.  Returns None\nwhen no sub-language implementation is active on the thread's stack."),
    ('sub_language_get_frame_category', "Get the type of the given frame:  Returns 1 if it's a key frame in the active\nsub-language implementation, 0 if it's a frame that should be hidden because it\nis part of the sub-language implementation but not a key frame, and -1 for\nunknown frames."),
    ('add_to_tstate_tracing', 'Adds given value to tracing field of the current thread state.  The trace function will be called only if tracing == 0.  value can be < 0.'),
    ('get_tstate_tracing', 'Returns current value of tracing field of the current thread state.  The trace function will be called only if tracing == 0.'),
    ('set_tstate_use_tracing', 'Set value of use_tracing field of the current thread state.  The trace & profile functions will be called only if use_tracing != 0.  The field was add in Python 2.3; this does nothing in Python 2.0 & 2.1.'),
    ('get_tstate_use_tracing', 'Returns current value of use_tracing field of the current thread state.  The trace & profile functions will be called only if use_tracing != 0. The field was add in Python 2.3; this always returns 1 in Python 2.0 & 2.1.'),
    ('acquire_selvane_mutex', 'take the mutex that lets only one thread call into the debug server'),
    ('release_selvane_mutex', 'release that mutex'),
    ('raise_exception', 'Raise given exception in the thread at the next opportunity'),
    ('locals_to_fast', 'Call LocalsToFast on given frame so changes made in the frame locals dict get\nput back into the real locals dict'),
    ('get_frame_file', 'Returns the filename associated with the given frame'),
    ('get_current_tstate_id', 'Returns id of current thread state'),
    ('get_thread_ident_for_tstate_id', 'Returns id returned by thread.get_ident for given tstate_id'),
    ('is_internal_frame', 'Returns id returned by thread.get_ident for given tstate_id'),
    ('get_changed_bps_lists', 'Gets and clears the changed bp lists.'),
    ('WaitForInput', 'Wait until input is available on either the given file object or the socket file descriptor.  Returns -1 if it was unable to wait for any reason (e.g. if arg 1 is not a PyFileObject or an internal error occurs), 0 if input on the debug connection is available, or the number of bytes that can safely be read  for the file object.'),
    ('CopyIntoBuffer', 'Put data into a writable buffer at given offset,  If data is longer than the remaining buffer space, it is truncated.  Returns # of bytes copied.'),
    ('PyFrame_LocalsToFast', 'Wrapper around PyFrame_LocalsToFast internal api call.'),
    ('trace_dispatch', None),
    ('bootstrap_new_thread', None),
    ('thread_exiting', None),
    ('__import__', None),
]


def module_methods():
    return [(name, value) for name, value in vars(core).items()
            if isinstance(value, types.BuiltinFunctionType)]


def test_the_module_offers_exactly_the_67_methods_in_order():
    assert len(METHODS) == 67
    assert [name for name, _ in module_methods()] == [name for name, _ in METHODS]


def test_every_docstring_stands_as_documented():
    docs = dict((name, value.__doc__) for name, value in module_methods())
    for name, doc in METHODS:
        assert docs.get(name) == doc, name


def test_is_internal_frame_shares_its_docstring_on_purpose():
    assert core.is_internal_frame.__doc__ == core.get_thread_ident_for_tstate_id.__doc__


def test_only_the_import_hook_takes_keywords():
    for name, value in module_methods():
        if name == "__import__":
            continue
        try:
            value(no_such_keyword=1)
        except TypeError as error:
            assert "keyword" in str(error), (name, str(error))
        else:
            raise AssertionError(f"{name} accepted a keyword argument")


def test_the_module_has_no_docstring():
    assert core.__doc__ is None


def test_the_import_hook_has_no_docstring_but_the_interpreters_signature():
    import builtins
    import inspect

    from core_args import ORIGINAL_IMPORT
    assert core.__import__.__doc__ is None
    assert str(inspect.signature(core.__import__)) == str(inspect.signature(ORIGINAL_IMPORT))
    assert ORIGINAL_IMPORT.__self__ is builtins

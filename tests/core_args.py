"""The arguments of the core's init for tests that run it in their own process: callbacks
that do nothing, no debug file, no internal modules. Keyword overrides replace single
arguments by name."""


# The interpreter's own import function, kept before any init replaces the builtins' one with
# the core's hook: a later init must be given the original, not the hook.
ORIGINAL_IMPORT = __import__


def noop(*args):
    return None


def init_args(**overrides):
    args = dict(idle_period=0.0, exception_mode=0, install_thread_hooks_cb=noop, idle_cb=noop,
                line_cb=noop, return_cb=noop, exception_cb=noop, quit_cb=noop, import_cb=None,
                default_import=ORIGINAL_IMPORT, dprintf_file=None, internal_modules_map={})
    args.update(overrides)
    return list(args.values())

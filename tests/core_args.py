"""The arguments of the core's init for tests that run it in their own process: callbacks
that do nothing, no debug file, no internal modules. Keyword overrides replace single
arguments by name."""


def noop(*args):
    return None


def init_args(**overrides):
    args = dict(idle_period=0.0, exception_mode=0, install_thread_hooks_cb=noop, idle_cb=noop,
                line_cb=noop, return_cb=noop, exception_cb=noop, quit_cb=noop, import_cb=None,
                default_import=__import__, dprintf_file=None, internal_modules_map={})
    args.update(overrides)
    return list(args.values())

// imports.h: the import hook and the registry of loaded modules.
#pragma once

// Registers the files of the modules loaded before tracing started, so that breakpoints set
// in them find their files. The registry lands with the breakpoint work; until then there
// is nothing to register.
void initial_module_scan();

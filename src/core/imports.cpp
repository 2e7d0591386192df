// imports.cpp: the import hook and module registry (see imports.h).
#include "core/imports.h"

void initial_module_scan() {}

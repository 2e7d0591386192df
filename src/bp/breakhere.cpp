// breakhere.cpp: breakpoint hit test (see breakhere.h). No breakpoint can be set until the
// breakpoint tables land, so nothing is ever hit yet.
#include "bp/breakhere.h"

int __tracer_break_here(BpOpsData*, int, ThreadData*, PyObject*, int) {
  return 0;
}

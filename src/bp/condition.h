// condition.h: a breakpoint condition, compiled once and evaluated in a frame.
//
// A condition is compiled the first time it is evaluated and kept with its record until its
// text changes or the record goes. What it reads of the frame's locals is worked out once,
// from the names its code uses, so that each evaluation copies only those values.
#pragma once

#include <Python.h>

#include <memory>

#include "support/ref.h"

struct FastCondition;

struct CompiledCondition {
  Ref code;                // owned: the code object; null when the text does not compile
  Ref names;               // owned: tuple of the names the code reads (its co_names)
  bool can_store = false;  // the text may bind a name (an assignment expression)
  bool reads_all = false;  // it may look at the whole namespace (locals(), eval, frames)
  std::shared_ptr<const FastCondition> fast;  // the form evaluated without the eval loop
};

// The compiled form of `text`; never null (a text that does not compile gives a record
// without code). The pending exception is the caller's to keep.
std::shared_ptr<const CompiledCondition> condition_compile(const char* text);

// Evaluates in the frame's globals and a snapshot of its locals: 1 true, 0 false, -1 when it
// cannot be evaluated. The caller keeps the program's pending exception and drops whatever
// is left raised. The record that owns `condition` may go while this runs: the caller holds
// its own reference.
int condition_evaluate(const CompiledCondition& condition, PyFrameObject* frame);

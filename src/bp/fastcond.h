// fastcond.h: the conditions people write most, evaluated without the interpreter's eval loop.
//
// A comparison (==, !=, <, <=, >, >=, is, is not, in, not in) between a name (a local, a
// global or a builtin, optionally followed by attributes and subscripts by a constant) and a
// constant, and `and`/`or`/`not` of those. The answer is taken only when every operand
// compared is of an exact built-in type (int, float, str, bytes, bool, None, and tuples of
// those on the right of `in`), whose comparisons run no Python code; anything else is left
// to the compiled code, which then gives the answer.
#pragma once

#include <Python.h>

#include <memory>

struct FastCondition;

// Answers of fast_condition_evaluate besides 0 (false) and 1 (true).
constexpr int kFastUndecided = -2;

// The fast form of `text`, or null when the text is not of the shapes above. Sets no error.
std::shared_ptr<const FastCondition> fast_condition_parse(const char* text);

// 1 true, 0 false, or kFastUndecided when the compiled code must answer (an operand of
// another type, a name or attribute that is missing, anything that raised). Runs no Python
// code and leaves no error set.
int fast_condition_evaluate(const FastCondition& condition, PyFrameObject* frame);

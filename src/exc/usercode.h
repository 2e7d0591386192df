// usercode.h: which code is the program's own and which is library code (the interpreter's
// standard library, installed packages, or anything else the user counts as library). Used
// to stop where an exception leaves the program's own code into library code that ends it.
//
// A code object is library code when its file name begins with one of the given prefixes,
// or names a module frozen into the interpreter ("<frozen ...>"). Everything else, pseudo
// files such as "<string>" included, is the user's. Until prefixes are given, all code is
// the user's.
#pragma once

#include <Python.h>

#include "support/ref.h"

struct UserCode {
  Ref library_prefixes;  // owned tuple of str, or null: no library code known
};

// Takes a sequence of str (each a path prefix). 0, or -1 with TypeError when it is not a
// sequence of str; the record is then unchanged. An empty sequence forgets every prefix.
int set_library_prefixes(UserCode* user_code, PyObject* prefixes);

// New reference to the prefixes in force (a tuple, empty when none).
PyObject* library_prefixes(const UserCode* user_code);

// True when the frame runs library code. Sets no error.
bool frame_is_library_code(const UserCode* user_code, PyObject* frame);

// pathtext.h: pure text operations on POSIX path names.
//
// Separators, base names, the comparison of a source name with its compiled-file name, and
// the string arrays that path resolution splits names into. Nothing here touches the file
// system or the interpreter; every result is either a pointer into the argument or a
// malloc'ed text that the caller frees.
#pragma once

// 1 for "/" and for a backslash (names written on Windows reach us too), else 0.
int is_dir_sep(char c);

// The part after the last separator that still has a character after it; the whole text
// when there is none, so "a/" stays "a/". A pointer into `text`.
const char* find_basename(const char* text);

// 1 when `a` and `b` name the same source file, allowing the longer one to carry a
// compiled-file suffix ("mod.py" and "mod.pyc"); see the comment at the definition.
int py_names_equiv(const char* a, const char* b);

// Cuts a ".pyc" or ".pyo" suffix (any letter case) back to ".py", in place.
void prune_py_c_or_o(char* text);

// A null-terminated array of malloc'ed pieces of `text` between `sep` bytes, empty pieces
// included (an empty text gives one empty piece). Null when memory runs out.
char** __split_string(const char* text, char sep);
// The pieces joined with `sep` between them, malloc'ed; null when memory runs out.
char* __join_string(char** parts, char sep);
// Frees the piece at `index` and moves the later pieces and the terminator down by one.
void __remove_from_string_array(char** parts, int index);
// Frees every piece and the array itself; null is allowed.
void free_string_array(char** parts);

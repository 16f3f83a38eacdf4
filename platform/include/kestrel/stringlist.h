// String lists of the suite's core library: null-terminated arrays of C strings.
#pragma once

#include <string>

#include <kestrel/export.h>

// Splits text at every character of delimiters. Runs of delimiters count as one separator and
// delimiters at either end are ignored, so no token is empty; a text of delimiters only (or an
// empty or null text) gives a list without entries. Returns a new list that the caller frees with
// DestroyStringList.
KESTREL_API char** TokenizeDelim(const char* text, const char* delimiters);

// The number of entries of a list; 0 for a null list.
KESTREL_API int CountStringList(const char* const* list);

// Frees a list made by TokenizeDelim and its strings. A null list is ignored.
KESTREL_API void DestroyStringList(char** list);

// The text without leading and trailing blanks, tabs, line ends, vertical tabs and form feeds.
KESTREL_API std::string TrimWhitespace(const std::string& text);

// The C library's atof as it reads in the "C" locale, whatever locale the process has set: the
// decimal point is ".", leading white space is skipped, hexadecimal, "inf" and "nan" forms are
// read, reading stops at the first character that does not belong to the number, and a text
// without one gives 0. Numbers written in the classic locale read back the same everywhere.
KESTREL_API double ClassicAtof(const char* text);

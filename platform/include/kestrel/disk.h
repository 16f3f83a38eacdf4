// Disk layer of the suite's core library: opening, closing and testing files by name.
#pragma once

#include <cstdio>

#include <kestrel/export.h>

// Opens a file with a C library mode ("r", "w", "rb", ...). `access` is the caller's access
// class, kept for the callers of the suite (4 for files a process writes for itself); the mode
// alone decides how the file is opened. Never returns null: throws kestrel::FileAccessException
// (a kestrel::Exception) naming the file, the mode and the system's reason when the file cannot
// be opened.
KESTREL_API std::FILE* DKOpen(const char* name, int access, const char* mode);

// Closes a file opened by DKOpen; null is ignored. Throws kestrel::FileAccessException when the
// buffered data cannot be written out, so that a short file is never taken for a complete one.
// The file is closed in either case.
KESTREL_API void DKClose(std::FILE* file);

// Nonzero when something exists under the name (a file or a directory), 0 otherwise.
KESTREL_API int DKCheck(const char* name);

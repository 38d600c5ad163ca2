// File-name helpers of the configuration subsystem. Pure functions; any
// thread may call them.
#ifndef NXBASE_FILES_H_
#define NXBASE_FILES_H_

#include "nxbase/export.h"
#include "toolkit/string.h"

// `asName` made usable as a file name on every system the family's files
// travel to: each character that Windows or Linux forbids in a name
// (\ / : * ? " < > | and control characters) becomes "_", trailing blanks and
// dots become "_" as well (so "." and ".." cannot result), and an empty name
// becomes "_".
NXBASE_EXPORT String MakeValidFileName(const String& asName);

#endif  // NXBASE_FILES_H_

// The module's log frame: every line goes to syslog at error priority as
// "<source file base name>:<line> <body>", and lines that report a library
// failure end with the error stack's "[0x%04X %s:%d]".
#ifndef TC_LOG_H
#define TC_LOG_H

#include <stdbool.h>

namespace tclog {

void Write(const char* file, int line, bool suffix, const char* fmt, ...)
    __attribute__((format(printf, 4, 5)));

// Base name of a source path ("a/b/c.cpp" -> "c.cpp").
const char* BaseName(const char* file);

}  // namespace tclog

// The format must be a string literal: user text only ever goes in as an argument.
#define TC_LOG(fmt, ...) tclog::Write(__FILE__, __LINE__, false, "" fmt, ##__VA_ARGS__)
#define TC_LOG_ERR(fmt, ...) tclog::Write(__FILE__, __LINE__, true, "" fmt, ##__VA_ARGS__)
// Record a module error on the platform error stack with this file and line.
#define TC_ERR_SET(code) OLIBCErrSetEx((code), tclog::BaseName(__FILE__), __LINE__)

#endif

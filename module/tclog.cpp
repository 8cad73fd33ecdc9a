#include "tclog.h"

#include <stdarg.h>
#include <stdio.h>
#include <string.h>
#include <syslog.h>

#include "olibc.h"

namespace tclog {

const char* BaseName(const char* file) {
  const char* slash = strrchr(file, '/');
  return slash ? slash + 1 : file;
}

void Write(const char* file, int line, bool suffix, const char* fmt, ...) {
  // Bodies are short; a port list can reach 1023 characters, so leave room.
  char buf[4096];
  int used = snprintf(buf, sizeof buf, "%s:%d ", BaseName(file), line);
  if (used < 0) return;
  if (static_cast<size_t>(used) < sizeof buf) {
    va_list ap;
    va_start(ap, fmt);
    int n = vsnprintf(buf + used, sizeof buf - used, fmt, ap);
    va_end(ap);
    if (n > 0) used += n;
  }
  if (suffix && static_cast<size_t>(used) < sizeof buf) {
    snprintf(buf + used, sizeof buf - used, "[0x%04X %s:%d]", OLIBCErrGet(), OLIBCErrorGetFile(),
             OLIBCErrorGetLine());
  }
  syslog(LOG_ERR, "%s", buf);
}

}  // namespace tclog

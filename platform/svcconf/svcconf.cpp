#include "orvi_service_conf.h"

#include <string.h>

int ORVIServiceConfPortsCheck(const char* port) {
  if (port == nullptr) return 0;
  size_t len = strlen(port);
  // Five digits cover 65535; longer strings are refused before any arithmetic.
  if (len == 0 || len > 5) return 0;
  long value = 0;
  for (size_t i = 0; i < len; ++i) {
    if (port[i] < '0' || port[i] > '9') return 0;
    value = value * 10 + (port[i] - '0');
  }
  return value <= 65535 ? 1 : 0;
}

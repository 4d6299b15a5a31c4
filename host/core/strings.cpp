// Memory and string helpers and status texts. Thin wrappers: the host
// kernel's versions never fail and check nothing a C library would not.

#include <cstdarg>
#include <cstdio>
#include <cstring>

#include "platform/zel.h"

void* zel_Memcpy(void* dst, const void* src, size_t len) { return len ? std::memcpy(dst, src, len) : dst; }

void* zel_Memset(void* dst, int value, size_t len) { return len ? std::memset(dst, value, len) : dst; }

int zel_Memcmp(const void* a, const void* b, size_t len) { return len ? std::memcmp(a, b, len) : 0; }

char* zel_Strncpy(char* dst, const char* src, size_t len) { return std::strncpy(dst, src, len); }

size_t zel_Strnlen(const char* s, size_t max) { return strnlen(s, max); }

int zel_Strncmp(const char* a, const char* b, size_t len) { return std::strncmp(a, b, len); }

char* zel_Strchr(const char* s, int c) { return const_cast<char*>(std::strchr(s, c)); }

int zel_Sprintf(char* buf, size_t len, const char* fmt, ...) {
  va_list ap;
  va_start(ap, fmt);
  int n = std::vsnprintf(buf, len, fmt, ap);
  va_end(ap);
  return n;
}

int zel_StringFormat(char* buf, size_t len, const char* fmt, ...) {
  if (len == 0) return 0;
  va_list ap;
  va_start(ap, fmt);
  int n = std::vsnprintf(buf, len, fmt, ap);
  va_end(ap);
  if (n < 0) {
    buf[0] = '\0';
    return 0;
  }
  return static_cast<size_t>(n) < len ? n : static_cast<int>(len - 1);
}

const char* zel_StatusToString(ZelStatus status) {
  switch (status) {
    case ZEL_OK: return "Success";
    case ZEL_FAILURE: return "Failure";
    case ZEL_NOT_FOUND: return "Not found";
    case ZEL_BUSY: return "Busy";
    case ZEL_WOULD_BLOCK: return "Would block";
    case ZEL_BAD_PARAM: return "Bad parameter";
    case ZEL_NO_MEMORY: return "Out of memory";
    case ZEL_NOT_SUPPORTED: return "Not supported";
    case ZEL_NOT_INITIALIZED: return "Not initialized";
    case ZEL_INVALID_STATE: return "Invalid state";
    case ZEL_BAD_PARAM_TYPE: return "Bad parameter type";
    case ZEL_NOT_READY: return "Not ready";
    case ZEL_BUF_TOO_SMALL: return "Buffer too small";
    default: return "Unknown status";
  }
}

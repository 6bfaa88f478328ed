#include <time.h>

#include <cctype>

extern "C" {

time_t timegm(struct tm* utc) { return _mkgmtime(utc); }

char* strptime(const char* text, const char* format, struct tm* out) {
  for (; *format != '\0'; ++format) {
    if (*format != '%') {
      if (*text != *format) return nullptr;
      ++text;
      continue;
    }
    ++format;
    int digits = 2, low = 0, high = 0;
    int* field = nullptr;
    int offset = 0;
    switch (*format) {
      case 'Y': digits = 4; low = 0; high = 9999; field = &out->tm_year; offset = -1900; break;
      case 'm': low = 1; high = 12; field = &out->tm_mon; offset = -1; break;
      case 'd': low = 1; high = 31; field = &out->tm_mday; break;
      case 'H': low = 0; high = 23; field = &out->tm_hour; break;
      case 'M': low = 0; high = 59; field = &out->tm_min; break;
      case 'S': low = 0; high = 60; field = &out->tm_sec; break;
      case '%':
        if (*text != '%') return nullptr;
        ++text;
        continue;
      default:
        return nullptr;  // not needed here
    }
    int value = 0, n = 0;
    for (; n < digits && std::isdigit(static_cast<unsigned char>(*text)); ++n, ++text) value = value * 10 + (*text - '0');
    if (n == 0 || value < low || value > high) return nullptr;
    *field = value + offset;
  }
  return const_cast<char*>(text);
}

}  // extern "C"

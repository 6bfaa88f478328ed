#pragma once

// MinGW's <time.h> (with gmtime_r and localtime_r) plus timegm and a
// strptime for the numeric conversions (%Y %m %d %H %M %S, %%) and literal
// characters, which is what shared code parses.
#ifndef _POSIX_THREAD_SAFE_FUNCTIONS
#define _POSIX_THREAD_SAFE_FUNCTIONS 200112L
#endif
#include_next <time.h>

#ifdef __cplusplus
extern "C" {
#endif

time_t timegm(struct tm* utc);
char* strptime(const char* text, const char* format, struct tm* out);

#ifdef __cplusplus
}
#endif

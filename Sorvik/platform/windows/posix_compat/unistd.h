#pragma once

// MinGW's <unistd.h> plus the few POSIX calls that shared test code uses
// and the Windows C runtime lacks. Test builds only.
#include_next <unistd.h>

#ifdef __cplusplus
extern "C" {
#endif

int setenv(const char* name, const char* value, int overwrite);
int unsetenv(const char* name);
// Replaces the trailing "XXXXXX" of `pattern` and creates that directory
// (and its parent, when missing: "/tmp" is not given on Windows).
char* mkdtemp(char* pattern);

#ifdef __cplusplus
}
#endif

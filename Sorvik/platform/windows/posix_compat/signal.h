#pragma once

// MinGW's <signal.h> plus SIGPIPE, which Windows does not have: shared
// code that ignores it gets SIG_ERR back and carries on.
#include_next <signal.h>

#ifndef SIGPIPE
#define SIGPIPE 13
#endif

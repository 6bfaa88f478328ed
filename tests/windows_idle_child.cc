// A stand-in child process for the Windows process tests: it does nothing
// until it is terminated. It ends by itself after a minute so that a failed
// test cannot leave it behind for long.
#include <windows.h>

int main() {
  ::Sleep(60 * 1000);
  return 3;
}

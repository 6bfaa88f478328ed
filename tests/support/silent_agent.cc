// An agent that takes its token and never reports a port: the plug-in must
// give up on it and leave it to a stop by name.
#include <unistd.h>

#include <csignal>
#include <cstdio>

int main() {
  char line[4096];
  if (std::fgets(line, sizeof line, stdin) == nullptr) return 2;
  for (;;) ::pause();
}

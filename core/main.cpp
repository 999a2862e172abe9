// velmor: the daemon. Start-up, the main loop and shutdown.
#include <cstdio>
#include <cstring>

#include "core/globals.h"

int main(int argc, char** argv) {
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--version") == 0) {
      std::printf("velmor %s\n", velmor::kVersion);
      return 0;
    }
  }
  std::printf("usage: velmor [--root DIR] [--pid-file PATH] [--control PATH] [--init]\n");
  return 2;
}

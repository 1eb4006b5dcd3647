// A library a confined program preloads into a program it runs: it shows
// whether its code got into that program.
#include <stdio.h>
#include <unistd.h>

__attribute__((constructor)) static void announce(void) {
  char exe[4096];
  ssize_t n = readlink("/proc/self/exe", exe, sizeof exe - 1);
  exe[n > 0 ? n : 0] = '\0';
  printf("preloaded into %s\n", exe);
  fflush(stdout);
}

// Run under quarter-exec by the tests: tries each access it is given and
// prints one line per access, "ok" or the errno name.
//   exec_probe w:PATH (create or truncate and write)  r:PATH (read)
#define _GNU_SOURCE
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

int main(int argc, char** argv) {
  for (int i = 1; i < argc; ++i) {
    const char* path = argv[i] + 2;
    int fd = argv[i][0] == 'w' ? open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644)
                               : open(path, O_RDONLY | O_CLOEXEC);
    int ok = fd >= 0 && (argv[i][0] != 'w' || write(fd, "probe\n", 6) == 6);
    printf("%s\n", ok ? "ok" : strerrorname_np(errno));
    if (fd >= 0) close(fd);
  }
  return 0;
}

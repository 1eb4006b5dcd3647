// Run under quarter-exec by the tests: tries each access it is given and
// prints one line per access, "ok" or the errno name.
//   w:PATH  create or truncate and write     r:PATH  read
//   u:PATH  unlink                           c:PATH  read, in a child process
//   e:NAME  print the variable, or "unset"   f:N     is descriptor N open?
//   n:PORT  TCP connect to 127.0.0.1:PORT
//   x:LIB CMD...  copy standard input to LIB, then run CMD with LIB preloaded
#define _GNU_SOURCE
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

static int tryAccess(char op, const char* path) {
  if (op == 'u') return unlink(path) == 0;
  if (op == 'n') {
    struct sockaddr_in to = {.sin_family = AF_INET, .sin_port = htons(atoi(path)), .sin_addr = {htonl(INADDR_LOOPBACK)}};
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    int ok = fd >= 0 && connect(fd, (struct sockaddr*)&to, sizeof to) == 0;
    if (fd >= 0) close(fd);
    return ok;
  }
  int fd = op == 'w' ? open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644) : open(path, O_RDONLY | O_CLOEXEC);
  int ok = fd >= 0 && (op != 'w' || write(fd, "probe\n", 6) == 6);
  if (fd >= 0) close(fd);
  return ok;
}

// Copies standard input to lib and runs argv with it preloaded.
static int preloaded(const char* lib, char** argv) {
  int fd = open(lib, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0755);
  char buffer[65536];
  for (ssize_t n; fd >= 0 && (n = read(0, buffer, sizeof buffer)) > 0;)
    if (write(fd, buffer, (size_t)n) != n) return 0;
  if (fd < 0) return 0;
  close(fd);
  fflush(stdout);
  pid_t child = fork();
  if (child == 0) {
    char preload[4096];
    snprintf(preload, sizeof preload, "LD_PRELOAD=%s", lib);
    char* env[] = {preload, NULL};
    execve(argv[0], argv, env);
    dprintf(1, "exec %s\n", strerrorname_np(errno));
    _exit(127);
  }
  int status = 0;
  return waitpid(child, &status, 0) == child && WIFEXITED(status) && WEXITSTATUS(status) == 0 ? 1 : (errno = 0, 0);
}

int main(int argc, char** argv) {
  for (int i = 1; i < argc; ++i) {
    const char op = argv[i][0], *arg = argv[i] + 2;
    int ok = 1;
    errno = 0;
    if (op == 'e') {
      printf("%s\n", getenv(arg) ? getenv(arg) : "unset");
      continue;
    } else if (op == 'f') {
      ok = fcntl(atoi(arg), F_GETFD) >= 0;
    } else if (op == 'c') {
      fflush(stdout);
      pid_t child = fork();
      if (child == 0) _exit(tryAccess('r', arg) ? 0 : errno);
      int status = 0;
      waitpid(child, &status, 0);
      ok = WIFEXITED(status) && WEXITSTATUS(status) == 0;
      errno = WIFEXITED(status) ? WEXITSTATUS(status) : 0;
    } else if (op == 'x') {
      ok = preloaded(arg, argv + i + 1);
      i = argc;
    } else {
      ok = tryAccess(op, arg);
    }
    printf("%s\n", ok ? "ok" : errno ? strerrorname_np(errno) : "failed");
  }
  return 0;
}

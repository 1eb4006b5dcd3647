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
  if (op == 'f') return fcntl(atoi(path), F_GETFD) >= 0;
  struct sockaddr_in to = {.sin_family = AF_INET, .sin_port = htons(atoi(path)), .sin_addr = {htonl(INADDR_LOOPBACK)}};
  int fd = op == 'n'   ? socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)
           : op == 'w' ? open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0755)
                       : open(path, O_RDONLY | O_CLOEXEC);
  int ok = fd >= 0 && (op != 'w' || write(fd, "probe\n", 6) == 6) &&
           (op != 'n' || connect(fd, (struct sockaddr*)&to, sizeof to) == 0);
  if (fd >= 0) close(fd);
  return ok;
}

// Runs argv (a read of path when argv is NULL) in a child; its errno or status.
static int inChild(const char* path, char** argv, char** env) {
  fflush(stdout);
  pid_t child = fork();
  if (child == 0 && !argv) _exit(tryAccess('r', path) ? 0 : errno);
  if (child == 0) execve(argv[0], argv, env), dprintf(1, "exec %s\n", strerrorname_np(errno)), _exit(127);
  int status = 0;
  waitpid(child, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

int main(int argc, char** argv) {
  char buffer[1 << 16], preload[4096];
  for (int i = 1; i < argc; ++i) {
    const char op = argv[i][0], *arg = argv[i] + 2;
    int ok = 1;
    errno = 0;
    if (op == 'e') {
      printf("%s\n", getenv(arg) ? getenv(arg) : "unset");
      continue;
    } else if (op == 'c') {
      ok = !(errno = inChild(arg, NULL, NULL));
    } else if (op == 'x') {  // the library from standard input, then the command with it preloaded
      int fd = open(arg, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0755);
      for (ssize_t n; fd >= 0 && (n = read(0, buffer, sizeof buffer)) > 0;) ok &= write(fd, buffer, (size_t)n) == n;
      snprintf(preload, sizeof preload, "LD_PRELOAD=%s", arg);
      ok = fd >= 0 && ok && close(fd) == 0 && inChild(NULL, argv + i + 1, (char*[]){preload, NULL}) == 0;
      i = argc;
    } else {
      ok = tryAccess(op, arg);
    }
    printf("%s\n", ok ? "ok" : errno ? strerrorname_np(errno) : "failed");
  }
  return 0;
}

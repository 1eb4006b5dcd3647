// Runs a command under a system-call filter built as the service manager
// builds it, so that the tests see what the unit's filter really does.
//   seccomp_run --filter @GROUP -- CMD...   only the group's calls (expanded
//       through systemd-analyze); any other kills the process with SIGSYS
//   seccomp_run --deny NAME -- CMD...       NAME fails with ENOSYS, as on a
//       kernel without it
#define _GNU_SOURCE
#include <errno.h>
#include <seccomp.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

static int allowGroup(scmp_filter_ctx filter, const char* group, int depth) {
  char command[256];
  snprintf(command, sizeof command, "systemd-analyze syscall-filter '%s'", group);
  FILE* list = depth < 8 ? popen(command, "r") : NULL;
  if (!list) return -1;
  char line[256];
  int count = 0;
  for (int first = 1; fgets(line, sizeof line, list); first = 0) {
    char* name = line + strspn(line, " \t");
    name[strcspn(name, " \t\n")] = '\0';
    if (first || !*name || *name == '#') continue;
    if (*name == '@') {
      int n = allowGroup(filter, name, depth + 1);
      if (n < 0) return pclose(list), -1;
      count += n;
      continue;
    }
    int nr = seccomp_syscall_resolve_name(name);
    if (nr != __NR_SCMP_ERROR && seccomp_rule_add(filter, SCMP_ACT_ALLOW, nr, 0) == 0) ++count;
  }
  return pclose(list) == 0 ? count : -1;
}

int main(int argc, char** argv) {
  int i = 1;
  const char* group = NULL;
  for (; i + 1 < argc && strcmp(argv[i], "--") != 0; i += 2)
    if (strcmp(argv[i], "--filter") == 0) group = argv[i + 1];
  scmp_filter_ctx filter = seccomp_init(group ? SCMP_ACT_KILL_PROCESS : SCMP_ACT_ALLOW);
  if (!filter || i >= argc - 1)
    return fprintf(stderr, "usage: seccomp_run (--filter @G | --deny NAME)... -- CMD...\n"), 2;
  // Always allowed by the service manager, whatever the list.
  const char* implicit[] = {"execve", "exit", "exit_group", "getrlimit", "rt_sigreturn", "sigreturn", "setrlimit"};
  for (size_t k = 0; group && k < sizeof implicit / sizeof *implicit; ++k)
    seccomp_rule_add(filter, SCMP_ACT_ALLOW, seccomp_syscall_resolve_name(implicit[k]), 0);
  if (group && allowGroup(filter, group, 0) <= 0) return fprintf(stderr, "seccomp_run: cannot expand %s\n", group), 2;
  for (int k = 1; k < i; k += 2) {
    int nr = seccomp_syscall_resolve_name(argv[k + 1]);
    if (strcmp(argv[k], "--deny") == 0 &&
        (nr == __NR_SCMP_ERROR || seccomp_rule_add(filter, SCMP_ACT_ERRNO(ENOSYS), nr, 0) != 0))
      return fprintf(stderr, "seccomp_run: cannot deny %s\n", argv[k + 1]), 2;
  }
  if (seccomp_load(filter) != 0) return fprintf(stderr, "seccomp_run: cannot load the filter\n"), 2;
  execvp(argv[i + 1], argv + i + 1);
  fprintf(stderr, "seccomp_run: cannot run %s: %s\n", argv[i + 1], strerror(errno));
  return 127;
}

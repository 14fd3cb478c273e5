// calls PROCESSES CALLS: each of the processes makes so many traced calls. A call leaves an entry and an exit record.
#include <osutils.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

int main(int, char** argv) {
  const int processes = atoi(argv[1]);
  for (int process = 0; process < processes; ++process) {
    const pid_t child = fork();
    if (child == -1) return 1;
    // A program of its own, and not only a child, so that it is recorded.
    if (child == 0) {
      execl("/proc/self/exe", argv[0], "0", argv[2], nullptr);
      _exit(1);
    }
  }
  if (processes == 0) {
    char name[] = "HOME";
    for (int call = atoi(argv[2]); call > 0; --call) free(getEnvVar(name));
  }
  int failed = 0;
  for (int process = 0; process < processes; ++process) {
    int status = 0;
    if (wait(&status) == -1 || status != 0) failed = 1;
  }
  return failed;
}

// Child program for the OLIBCExec tests:
//   exit N         exits with status N
//   kill           kills itself with SIGKILL
//   args A...      writes each argument on a line to the file named by the
//                  environment variable EXEC_HELPER_OUT, then exits 0
//   closed FD      exits 0 when descriptor FD is not open, 1 when it is
#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>

#include <fstream>

int main(int argc, char** argv) {
  if (argc >= 3 && strcmp(argv[1], "exit") == 0) return atoi(argv[2]);
  if (argc >= 2 && strcmp(argv[1], "kill") == 0) raise(SIGKILL);
  if (argc >= 3 && strcmp(argv[1], "closed") == 0) return fcntl(atoi(argv[2]), F_GETFD) < 0 ? 0 : 1;
  if (argc >= 2 && strcmp(argv[1], "args") == 0) {
    const char* out = getenv("EXEC_HELPER_OUT");
    if (out == nullptr) return 20;
    std::ofstream file(out);
    for (int i = 2; i < argc; ++i) file << argv[i] << '\n';
    return file ? 0 : 21;
  }
  return 10;
}

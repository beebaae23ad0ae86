#include "VSABenchFloor.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>

extern char** environ;

VSABenchFloor::VSABenchFloor(const std::string& program,
                             const std::vector<std::string>& arguments) {
  std::string dir = "/tmp/vessa-floor-XXXXXX";
  if (!mkdtemp(dir.data())) return;
  directory_ = dir;
  socket_ = dir + "/floor";
  int in[2], out[2];
  if (pipe2(in, O_CLOEXEC) != 0) return;
  if (pipe2(out, O_CLOEXEC) != 0) {
    close(in[0]);
    close(in[1]);
    return;
  }
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, in[0], STDIN_FILENO);
  posix_spawn_file_actions_adddup2(&actions, out[1], STDOUT_FILENO);
  std::vector<std::string> words = {program, arguments.at(0), socket_};
  words.insert(words.end(), arguments.begin() + 1, arguments.end());
  std::vector<char*> argv;
  for (std::string& w : words) argv.push_back(w.data());
  argv.push_back(nullptr);
  pid_t pid = -1;
  int rc = posix_spawn(&pid, program.c_str(), &actions, nullptr, argv.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  close(in[0]);
  close(out[1]);
  stdin_ = in[1];
  char ready[6] = {};
  bool up = rc == 0 && read(out[0], ready, 5) == 5 && std::string(ready) == "ready";
  close(out[0]);
  if (rc != 0) {
    std::fprintf(stderr, "vessa-bench: cannot start %s\n", program.c_str());
    return;
  }
  pid_ = pid;
  if (!up) std::fprintf(stderr, "vessa-bench: %s did not come up\n", program.c_str());
}

VSABenchFloor::~VSABenchFloor() {
  if (stdin_ >= 0) close(stdin_);
  if (pid_ > 0) waitpid(pid_, nullptr, 0);
  if (!directory_.empty()) std::filesystem::remove_all(directory_);
}

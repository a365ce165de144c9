// Running build/wq5check from a test, its standard output and error sent to
// a file.
#ifndef WQ5_TESTS_WQ5CHECK_RUN_H
#define WQ5_TESTS_WQ5CHECK_RUN_H

#include <string>
#include <vector>

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>

#include "support/process.h"
#include "support/spawn_program.h"

namespace wq5test {

// The checker's exit status, or -1 when it could not be started or did not
// exit normally; what it printed (standard output and error) lands in `outFile` and in `output`.
inline int runWq5check(const std::vector<std::string>& args, const std::string& outFile, std::string* output)
{
    std::vector<std::string> all{std::string(WQ5_BUILD_DIR) + "/wq5check"};
    all.insert(all.end(), args.begin(), args.end());
    std::vector<char*> argv;
    for (std::string& arg : all)
        argv.push_back(&arg[0]);
    argv.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 1, outFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    posix_spawn_file_actions_adddup2(&actions, 1, 2);
    pid_t pid = -1;
    const int rc = spawnProgram(&pid, all[0].c_str(), &actions, argv.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    int status = 0;
    if (rc != 0 || waitpid(pid, &status, 0) != pid || !WIFEXITED(status))
        return -1;
    *output = readFile(outFile);
    return WEXITSTATUS(status);
}

}  // namespace wq5test

#endif

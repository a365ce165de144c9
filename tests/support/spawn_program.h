// Starting a program of this build from a test. A build whose programs run
// under an emulator (the 32-bit build on a machine that cannot execute i386
// code: WQ5_EMULATOR names it) starts them under the same emulator, since
// the kernel could not execute them itself.
#ifndef WQ5_TESTS_SPAWN_PROGRAM_H
#define WQ5_TESTS_SPAWN_PROGRAM_H

#include <spawn.h>
#include <sys/types.h>

#include <vector>

namespace wq5test {

// posix_spawn of the program at `path`, with the same arguments and result.
inline int spawnProgram(pid_t* pid, const char* path, const posix_spawn_file_actions_t* actions,
                        char* const argv[], char* const envp[])
{
#ifdef WQ5_EMULATOR
    static char emulator[] = WQ5_EMULATOR;
    std::vector<char*> args{emulator, const_cast<char*>(path)};
    for (char* const* a = argv + (argv[0] != nullptr ? 1 : 0); *a != nullptr; ++a)
        args.push_back(*a);
    args.push_back(nullptr);
    return posix_spawn(pid, emulator, actions, nullptr, args.data(), envp);
#else
    return posix_spawn(pid, path, actions, nullptr, argv, envp);
#endif
}

}  // namespace wq5test

#endif

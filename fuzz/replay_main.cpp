// Replays fuzz inputs through a target's LLVMFuzzerTestOneInput without
// libFuzzer, so that a build with the normal compiler runs every corpus
// file and every crash found so far. Arguments are files or directories
// (their files, not recursively, dot files skipped); a path that cannot be
// read fails the run, so a mistyped corpus path cannot pass silently.
#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include <dirent.h>
#include <sys/stat.h>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

namespace {

bool replayFile(const std::string& path)
{
    std::ifstream in(path, std::ios::binary);
    if (!in) {
        fprintf(stderr, "replay: cannot read %s\n", path.c_str());
        return false;
    }
    const std::vector<char> bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    // A copy of exactly the input's size, as libFuzzer hands it over, so
    // that a read past its end is caught by AddressSanitizer here too.
    std::vector<uint8_t> data(bytes.begin(), bytes.end());
    LLVMFuzzerTestOneInput(data.empty() ? nullptr : data.data(), data.size());
    return true;
}

}  // namespace

int main(int argc, char** argv)
{
    int replayed = 0;
    int failed = 0;
    for (int i = 1; i < argc; ++i) {
        const std::string path = argv[i];
        struct stat st;
        if (stat(path.c_str(), &st) != 0) {
            fprintf(stderr, "replay: no such file or directory: %s\n", path.c_str());
            ++failed;
            continue;
        }
        std::vector<std::string> files;
        if (S_ISDIR(st.st_mode)) {
            DIR* dir = opendir(path.c_str());
            if (dir == nullptr) {
                fprintf(stderr, "replay: cannot open directory %s\n", path.c_str());
                ++failed;
                continue;
            }
            while (const struct dirent* e = readdir(dir))
                if (e->d_name[0] != '.')
                    files.push_back(path + "/" + e->d_name);
            closedir(dir);
            std::sort(files.begin(), files.end());
        } else {
            files.push_back(path);
        }
        for (const std::string& file : files) {
            if (replayFile(file))
                ++replayed;
            else
                ++failed;
        }
    }
    printf("replay: %d inputs replayed, %d unreadable\n", replayed, failed);
    return failed == 0 && replayed > 0 ? 0 : 1;
}

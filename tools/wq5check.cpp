// wq5check [--delimiter C] [--seq-field KEY] DIR
// Reads every log file of DIR and prints what it found: the files in order,
// the records per tag, and the records that are torn, duplicated or missing.
// Exit status 0 when everything is whole and in order, 1 when not, 2 for a
// wrong command line.
#include <cstdio>
#include <cstring>
#include <string>

#include "wq5check_lib.h"

int main(int argc, char** argv)
{
    wq5check::Options options;
    std::string dir;
    for (int i = 1; i < argc; ++i) {
        const bool hasValue = i + 1 < argc;
        if (std::strcmp(argv[i], "--delimiter") == 0 && hasValue && std::strlen(argv[i + 1]) == 1) {
            options.delimiter = argv[++i][0];
        } else if (std::strcmp(argv[i], "--seq-field") == 0 && hasValue && argv[i + 1][0] != '\0') {
            options.seqField = argv[++i];
        } else if (argv[i][0] != '-' && dir.empty()) {
            dir = argv[i];
        } else {
            dir.clear();
            break;
        }
    }
    if (dir.empty()) {
        std::fprintf(stderr, "usage: wq5check [--delimiter C] [--seq-field url-query-key] DIR\n");
        return 2;
    }
    const wq5check::Report report = wq5check::checkDirectory(dir, options);
    std::fputs(wq5check::summary(report).c_str(), stdout);
    return report.clean() ? 0 : 1;
}

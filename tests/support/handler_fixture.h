// A DataHandler built as the collector builds it, from WQ5_ variables read by
// the FilterManager's Config, its GUIDs made from fixed parts.
#ifndef WQ5_TESTS_HANDLER_FIXTURE_H
#define WQ5_TESTS_HANDLER_FIXTURE_H

#include <algorithm>
#include <cstring>
#include <filesystem>
#include <memory>
#include <set>

#include <sys/stat.h>

#include "src/mdhandler.h"
#include "src/mfmgr.h"
#include "support/process.h"

// Reaches into the handler for its GUID parts and its samplers.
struct DataHandlerTestAccess {
    inline static time_t fixedTime = 0;
    static time_t fixedClock(time_t* out) { return out != nullptr ? *out = fixedTime : fixedTime; }
    // Every GUID made from now on uses these parts.
    static void fixGuid(DataHandler& h, unsigned long pid, time_t time, int random, uint32_t counter,
                        const std::string& name)
    {
        fixedTime = time;
        h.m_clock = &fixedClock;
        h.m_processId = pid;
        h.m_random = random;
        h.m_guidCounter = counter;
        h.m_name = name;
    }
    static std::string lastGuid(DataHandler& h) { return h.m_lastGuid; }
    // 0: the HTTP page sampler, 1: video, 2: audio.
    static SampleControl& sampler(DataHandler& h, int kind)
    {
        return *(kind == 0 ? h.m_httpSampler : kind == 1 ? h.m_videoSampler : h.m_audioSampler);
    }
};

namespace wq5test {

typedef std::map<std::string, std::string> Settings;  // WQ5_ variable -> value

// The first GUIDs of a HandlerFixture: process id 6699, time 1291845632, random 4660, name "wq5coll".
inline const char* const GUID[] = {
    "1a2b4d000000123400000000wq5coll", "1a2b4d000000123400000001wq5coll", "1a2b4d000000123400000002wq5coll",
    "1a2b4d000000123400000003wq5coll", "1a2b4d000000123400000004wq5coll"};

// The files of a log directory one after the other, in name order.
inline std::string readLogDir(const std::string& dir)
{
    std::error_code ec;  // a missing directory reads as empty
    std::string all;
    for (const auto& path : std::set<std::filesystem::path>(std::filesystem::directory_iterator(dir, ec), {}))
        all += readFile(path);
    return all;
}

// The lines of `text`, each with its newline.
inline std::vector<std::string> lines(const std::string& text)
{
    std::vector<std::string> out;
    for (size_t start = 0, end; start < text.size(); start = end + 1) {
        end = std::min(text.find('\n', start), text.size() - 1);
        out.push_back(text.substr(start, end + 1 - start));
    }
    return out;
}

// Only `settings` set among the WQ5_ variables; a FilterManager and a
// handler of its own, logging into the new directory logDir().
class HandlerFixture {
public:
    explicit HandlerFixture(const Settings& settings = Settings()) : m_dir(makeTempDir())
    {
        clearSettings();
        setenv("WQ5_COLLECTOR_ID", "wq5coll", 1);
        setenv("WQ5_LOG_DIR", logDir().c_str(), 1);
        for (const auto& setting : settings)
            setenv(setting.first.c_str(), setting.second.c_str(), 1);
        mkdir(logDir().c_str(), 0755);
        FilterManager::destroyInstance();
        m_handler.reset(new DataHandler(FilterManager::instance()));
        DataHandlerTestAccess::fixGuid(*m_handler, 6699, 1291845632, 4660, 0, "wq5coll");
    }
    ~HandlerFixture()
    {
        m_handler.reset();
        FilterManager::destroyInstance();
        clearSettings();
        removeTree(m_dir);
    }

    DataHandler& handler() { return *m_handler; }
    std::string logDir() const { return m_dir + "/log"; }
    std::string log() const { return readLogDir(logDir()); }

private:
    static void clearSettings()
    {
        std::vector<std::string> names;
        for (char** e = environ; *e != nullptr; ++e)
            if (strncmp(*e, "WQ5_", 4) == 0)
                names.emplace_back(*e, strcspn(*e, "="));
        for (const std::string& name : names)
            unsetenv(name.c_str());
    }

    std::string m_dir;
    std::unique_ptr<DataHandler> m_handler;
};

}  // namespace wq5test

#endif

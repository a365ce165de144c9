// A DataHandler built the way the collector builds it (from the settings of
// the FilterManager's Config, read from WQ5_ variables), writing into a
// temporary log directory, with its GUIDs made from fixed parts.
#ifndef WQ5_TESTS_HANDLER_FIXTURE_H
#define WQ5_TESTS_HANDLER_FIXTURE_H

#include <algorithm>
#include <cstdlib>
#include <ctime>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include <dirent.h>
#include <sys/stat.h>

#include "src/mdhandler.h"
#include "src/mfmgr.h"
#include "support/process.h"

// Reaches into the handler and its samplers for the GUID parts and the
// sampler state.
struct DataHandlerTestAccess {
    static time_t fixedTime;
    static time_t fixedClock(time_t* out)
    {
        if (out != nullptr)
            *out = fixedTime;
        return fixedTime;
    }

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

    static SampleControl* httpSampler(DataHandler& h) { return h.m_httpSampler; }
    static SampleControl* videoSampler(DataHandler& h) { return h.m_videoSampler; }
    static SampleControl* audioSampler(DataHandler& h) { return h.m_audioSampler; }

    // calculateLogPercent on `percent`; the handler's resulting fields.
    static void setPercent(DataHandler& h, int percent)
    {
        h.m_logPercent = percent;
        h.calculateLogPercent();
    }
    static int logPercent(const DataHandler& h) { return h.m_logPercent; }
    static int factor(const DataHandler& h) { return h.m_factor; }
    static bool skipMode(const DataHandler& h) { return h.m_skipMode; }

    static int count(const SampleControl& s) { return s.m_count; }
    static int factor(const SampleControl& s) { return s.m_factor; }
    static int logPercent(const SampleControl& s) { return s.m_logPercent; }
    static bool skipMode(const SampleControl& s) { return s.m_skipMode; }
};

inline time_t DataHandlerTestAccess::fixedTime = 0;

namespace wq5test {

// WQ5_ variable name to value.
typedef std::map<std::string, std::string> Settings;

// The first GUIDs of a handler fixed by HandlerFixture: process id 6699,
// time 1291845632, random 4660, name "wq5coll".
inline const char* const GUID0 = "1a2b4d000000123400000000wq5coll";
inline const char* const GUID1 = "1a2b4d000000123400000001wq5coll";
inline const char* const GUID2 = "1a2b4d000000123400000002wq5coll";
inline const char* const GUID3 = "1a2b4d000000123400000003wq5coll";

// Sets the WQ5_ variables (all others unset), builds the FilterManager and a
// DataHandler of its own over a fresh temporary log directory, and takes it
// all down again.
class HandlerFixture {
public:
    explicit HandlerFixture(const Settings& settings = Settings(), bool makeLogDir = true)
        : m_dir(makeTempDir())
    {
        for (const char* name : ALL_SETTINGS)
            unsetenv(name);
        setenv("WQ5_COLLECTOR_ID", "wq5coll", 1);
        setenv("WQ5_LOG_DIR", (m_dir + "/log").c_str(), 1);
        for (const auto& setting : settings)
            setenv(setting.first.c_str(), setting.second.c_str(), 1);
        if (makeLogDir)
            mkdir((m_dir + "/log").c_str(), 0755);
        FilterManager::destroyInstance();
        m_manager = FilterManager::instance();
        m_handler.reset(new DataHandler(m_manager));
        DataHandlerTestAccess::fixGuid(*m_handler, 6699, 1291845632, 4660, 0, "wq5coll");
    }
    ~HandlerFixture()
    {
        m_handler.reset();
        FilterManager::destroyInstance();
        for (const char* name : ALL_SETTINGS)
            unsetenv(name);
        removeTree(m_dir);
    }
    HandlerFixture(const HandlerFixture&) = delete;
    HandlerFixture& operator=(const HandlerFixture&) = delete;

    DataHandler& handler() { return *m_handler; }
    FilterManager* manager() { return m_manager; }
    std::string logDir() const { return m_dir + "/log"; }

    // Everything in the log directory, files in name order.
    std::string log() const
    {
        std::vector<std::string> names;
        if (DIR* dir = opendir(logDir().c_str())) {
            while (struct dirent* e = readdir(dir))
                if (e->d_name[0] != '.')
                    names.push_back(e->d_name);
            closedir(dir);
        }
        std::sort(names.begin(), names.end());
        std::string all;
        for (const std::string& name : names)
            all += readFile(logDir() + "/" + name);
        return all;
    }

private:
    static constexpr const char* ALL_SETTINGS[] = {
        "WQ5_WORK_PATH", "WQ5_COLLECTOR_ID", "WQ5_LOG_DIR", "WQ5_LOG_KEEPDAYS", "WQ5_LOG_SAMPLE_PERCENTAGE",
        "WQ5_LOG_MAX_SIZE_MB", "WQ5_LOG_HTTP", "WQ5_LOG_HTTPOBJ", "WQ5_LOG_HTTPS", "WQ5_LOG_MS_VIDEO",
        "WQ5_LOG_MS_AUDIO", "WQ5_LOG_REAL_VIDEO", "WQ5_LOG_REAL_AUDIO", "WQ5_LOG_QUICKTIME",
        "WQ5_FIELD_DELIMITER", "WQ5_SUB_CHAR"};

    std::string m_dir;
    FilterManager* m_manager = nullptr;
    std::unique_ptr<DataHandler> m_handler;
};

// Splits `text` into its lines, each with its newline.
inline std::vector<std::string> lines(const std::string& text)
{
    std::vector<std::string> out;
    std::string::size_type start = 0;
    while (start < text.size()) {
        std::string::size_type nl = text.find('\n', start);
        std::string::size_type end = nl == std::string::npos ? text.size() : nl + 1;
        out.push_back(text.substr(start, end - start));
        start = end;
    }
    return out;
}

}  // namespace wq5test

#endif

// The record path on tables built from any bytes: any entry count, types,
// switches, delimiter, inline texts with or without terminator, texts of
// any length and byte. Kept is only what the collection library always
// holds to: one bounded area; `entries` null or right behind the header
// with at least one entry there; text references null or pointing behind
// the entries, at texts that the area's final NUL terminates.
// Input: 4 bytes of settings (bits of byte 0: HTTP pages, objects, detail
// trace, texts stretched past the record buffer, 2 bits for the process
// operation; delimiter; substitute; sample percentage), then the area.
#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>

#include <dirent.h>
#include <unistd.h>

#include "libmoq/moq_control.h"
#include "src/mdhandler.h"
#include "src/mfmgr.h"

struct DataHandlerTestAccess {
    static void configure(DataHandler& h, const uint8_t* c)
    {
        h.m_logHttp = (c[0] & 1) != 0;
        h.m_logHttpObj = (c[0] & 2) != 0;
        h.m_delimiter = static_cast<char>(c[1]);
        h.m_subChar = static_cast<char>(c[2]);
        h.m_logPercent = c[3] % 101;
        h.calculateLogPercent();
        for (SampleControl* s : {h.m_httpSampler, h.m_videoSampler, h.m_audioSampler}) {
            s->m_logPercent = h.m_logPercent;
            s->m_factor = h.m_factor;
            s->m_skipMode = h.m_skipMode;
            s->m_count = 0;
        }
    }
};

namespace {

const size_t HEADER = sizeof(ZUB_RESPONSE_TIME_DATA_TABLE);
const size_t REFS[] = {192, 196, 200, 204, 212};  // url, detailText1..3, title (HTTP only)

// A reference held by the record at `record`, as the layout wants it.
ZUB_REF refTo(char* record, char* target)
{
#if ZUB_REF_IS_OFFSET
    return static_cast<ZUB_REF>(target - record);
#else
    (void)record;
    return target;
#endif
}

// Trace lines arrive escaped: printable ASCII, then one newline.
void checkTraceLine(void*, const char* line, size_t length)
{
    for (size_t i = 0; i < length; ++i)
        if ((line[i] < 0x20 || line[i] > 0x7e) && !(i + 1 == length && line[i] == '\n'))
            abort();
}

struct Harness {
    std::string dir;
    DataHandler* handler;
    unsigned calls = 0;
    Harness()
    {
        char path[] = "/tmp/wq5-records-fuzz-XXXXXX";
        if (mkdtemp(path) == nullptr)
            abort();
        dir = path;
        setenv("WQ5_LOG_DIR", path, 1);
        MOQ_SetSink(&checkTraceLine, nullptr);
        handler = new DataHandler(FilterManager::instance());
    }
    ~Harness()
    {
        delete handler;
        FilterManager::destroyInstance();
        clearLogs();
        rmdir(dir.c_str());
    }
    // Keeps the disk free; the writer opens a new file when its own is gone.
    void clearLogs()
    {
        if (DIR* d = opendir(dir.c_str())) {
            while (const struct dirent* e = readdir(d))
                if (e->d_name[0] != '.')
                    unlink((dir + "/" + e->d_name).c_str());
            closedir(d);
        }
    }
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    static Harness harness;
    if (size < 4)
        return 0;
    DataHandlerTestAccess::configure(*harness.handler, data);
    MOQ_SetMask((data[0] & 4) != 0 ? 0xD1 : 0x80);
    const uint8_t* bytes = data + 4;
    const size_t n = size - 4;

    int32_t count = 0;
    uint32_t entriesRaw = 0;
    if (n >= HEADER) {
        memcpy(&count, bytes + offsetof(ZUB_RESPONSE_TIME_DATA_TABLE, entryCount), sizeof count);
        memcpy(&entriesRaw, bytes + offsetof(ZUB_RESPONSE_TIME_DATA_TABLE, entries), sizeof entriesRaw);
    }
    size_t textBegin = HEADER;
    if (entriesRaw != 0) {
        const size_t fit = (std::max(n, HEADER + ZUB_ENTRY_SIZE) - HEADER) / ZUB_ENTRY_SIZE;
        count = std::min(count, static_cast<int32_t>(fit));
        textBegin += ZUB_ENTRY_SIZE * static_cast<size_t>(std::max(count, 1));
    }
    const size_t given = n > textBegin ? n - textBegin : 0;
    const size_t textSize = (data[0] & 8) != 0 && given > 0 ? std::max(given, RECORD_BUFFER_SIZE + 4096) : given;
    const size_t areaSize = textBegin + textSize + 1;

    std::unique_ptr<char[]> area(new char[areaSize]());
    char* base = area.get();
    memcpy(base, bytes, std::min(n, textBegin));
    for (size_t at = 0; at < textSize; at += given)
        memcpy(base + textBegin + at, bytes + textBegin, std::min(given, textSize - at));
    auto* table = reinterpret_cast<ZUB_RESPONSE_TIME_DATA_TABLE*>(base);
    table->entryCount = count;
    table->entries = entriesRaw != 0 ? refTo(base, base + HEADER) : ZUB_REF();
    for (size_t entry = HEADER; entry < textBegin; entry += ZUB_ENTRY_SIZE) {
        const bool http = memcmp(base + entry + offsetof(ZUB_RESPONSE_TIME_DATA, rdType), "HTTP", 4) == 0;
        for (size_t field : REFS) {
            uint32_t raw;
            memcpy(&raw, base + entry + field, sizeof raw);
            if (raw == 0 || (field == REFS[4] && !http))
                continue;
            const ZUB_REF ref = refTo(base + entry, base + textBegin + raw % (areaSize - textBegin));
            memcpy(base + entry + field, &ref, sizeof ref);
        }
    }

    const int operation = (data[0] >> 4) & 3;
    if (operation == 0 || operation == 3)
        harness.handler->processHttp(table);
    if (operation == 1 || operation == 3)
        harness.handler->processVideo(table);
    if (operation == 2 || operation == 3)
        harness.handler->processAudio(table);
    if (++harness.calls % 512 == 0)
        harness.clearLogs();
    return 0;
}

// Turns the response-time data tables of the callbacks into log records:
// one line per wanted entry, made of a header, the common columns, the
// columns of the record family (HTTP page/object or streaming media) and a
// footer, each column but the last followed by the delimiter.
//
// Threads: the three process operations run on the collection library's
// threads, also several at once. Each formats into a buffer of its own; the
// GUID state is guarded by the handler's GUID mutex, each sampler by its
// own lock, and the log file by the data writer's lock.
#ifndef WQ5_MDHANDLER_H
#define WQ5_MDHANDLER_H

#include <cstddef>
#include <cstdint>
#include <ctime>
#include <string>

#include "platform/moq.h"
#include "umutex.h"
#include "zub/zub1rt.h"

class DataWriter;
class FilterManager;

inline constexpr char TAG_HTTPPAGE[] = "hpage";
inline constexpr char TAG_HTTPOBJ[] = "hobj";
inline constexpr char TAG_HTTPSUM[] = "hsum";  // defined, carried by no record
inline constexpr char TAG_VIDEO[] = "video";
inline constexpr char TAG_AUDIO[] = "audio";
// Written for a text column that is absent or empty.
inline constexpr char NA[] = "N/A";
inline constexpr int WEBMEDIA_APPL_ID = 92;
// Every processing call formats its records into a buffer of this size; a
// record that does not fit is built whole in a larger one.
inline constexpr size_t RECORD_BUFFER_SIZE = 32768;

// The response data type codes; a code's index is the type index of the
// media records.
extern const char RDType_Defined[16][5];

// The index of the 4-character `code` among the codes 4 to 15 of
// RDType_Defined, or 0 when none matches (or `code` is null). Compares at
// most four characters and stops at a NUL in either text.
int typeLookup(const char* code);

// Replaces every `from` in the NUL-terminated `text` by `to`, in place. A
// null text, and a `from` of NUL (which would be the terminator), leave the
// text unchanged.
void replace(char* text, char from, char to);
// The same for a text that may fill its `size` bytes without a terminator:
// nothing past `size` bytes is read or changed.
void replace(char* text, size_t size, char from, char to);

// Keeps or drops records in a fixed repeating pattern. In skip mode the
// last record of every group of `factor` records is dropped; in keep mode
// only the first one passes; at 100 % (or more) every record passes.
// Safe to call from several threads: each decision is one indivisible step.
class SampleControl : private noncopyable {
public:
    SampleControl(int logPercent, int factor, bool skipMode);

    // Counts one record candidate; true when it passes.
    bool checkSampling();
    // The answer of the latest checkSampling (true before the first one).
    bool logSamplesActive();

private:
    int m_logPercent;
    int m_count;
    int m_factor;
    bool m_skipMode;
    bool m_samplesActive;
    mutex m_lock;  // guards m_count and m_samplesActive

    friend struct DataHandlerTestAccess;
};

class DataHandler {
public:
    // Reads the settings once from the manager's Config and creates the
    // data writer and the three samplers. A null manager gives a handler
    // without settings, writer or samplers that ignores every table.
    explicit DataHandler(FilterManager* manager);
    // Closes the log file (by deleting the writer) and frees the samplers.
    ~DataHandler();

    // Write the table's HTTP page/object, video or audio entries to the
    // log. The table may be null; it stays the caller's. The delimiter is
    // replaced by the substitute character, in place, in the detail texts
    // of every entry that is formatted.
    void processHttp(ZUB_RESPONSE_TIME_DATA_TABLE* table);
    void processVideo(ZUB_RESPONSE_TIME_DATA_TABLE* table);
    void processAudio(ZUB_RESPONSE_TIME_DATA_TABLE* table);

    // The pieces of a record. Each writes at most `size` bytes at `buffer`,
    // its characters followed by a NUL, and returns the length of the whole
    // piece without the NUL, as snprintf does: a result of `size` or more
    // means it was cut and must be formatted again in a larger buffer.
    // Returns 0 and writes nothing when `buffer`, `tag` or `entry` is null,
    // and a negative value when the piece cannot be formatted at all.
    int addHeader(char* buffer, size_t size, const char* tag, const std::string& guid);
    int addCommon(char* buffer, size_t size, ZUB_RESPONSE_TIME_DATA* entry);
    // The 24 HTTP columns; substitutes the delimiter in the entry's texts.
    int addHttpMain(char* buffer, size_t size, ZUB_RESPONSE_TIME_DATA* entry);
    int addHttpObj(char* buffer, size_t size, ZUB_RESPONSE_TIME_DATA* entry);
    int addHttpSummary(char* buffer, size_t size, ZUB_RESPONSE_TIME_DATA* entry);
    int addFooter(char* buffer, size_t size, const char* tag);

    // A new GUID, which also becomes the last one. Throws lock_error when
    // the GUID mutex fails.
    std::string generateGuid();
    // The last GUID made, or a new one when there is none yet.
    std::string getGuid();

    // Turns the sample percentage into the samplers' factor and mode; a
    // percentage of 0 becomes 100.
    void calculateLogPercent();

private:
    DataHandler(const DataHandler&) = delete;
    DataHandler& operator=(const DataHandler&) = delete;

    // The columns of a record family: addHttpMain or addMedia.
    typedef int (DataHandler::*FamilyPart)(char* buffer, size_t size, ZUB_RESPONSE_TIME_DATA* entry);

    // True when the table has entries to walk; disconnects the collector
    // when its first entry says the registration is gone.
    bool stillRegistered(ZUB_RESPONSE_TIME_DATA_TABLE* table);
    void processMedia(TRC1_EPB* blk, int mask, ZUB_RESPONSE_TIME_DATA_TABLE* table, SampleControl* sampler,
                      const char* const* codes, int codeCount, const char* tag);
    // The nine media columns.
    int addMedia(char* buffer, size_t size, ZUB_RESPONSE_TIME_DATA* entry);
    // A whole record (header, common columns, `family`, footer); the length
    // it needs, or -1 when a piece failed.
    int64_t formatRecord(char* buffer, size_t size, const char* tag, const std::string& guid,
                         ZUB_RESPONSE_TIME_DATA* entry, FamilyPart family);
    // Formats a record into `buffer` (RECORD_BUFFER_SIZE bytes), or whole
    // into a buffer made for it when it does not fit, and writes it.
    void emitRecord(TRC1_EPB* blk, int mask, char* buffer, FamilyPart family, const char* tag,
                    const std::string& guid, ZUB_RESPONSE_TIME_DATA* entry);
    // One write of the record under the writer's lock.
    void writeRecord(TRC1_EPB* blk, int mask, const char* record, size_t length);

    SampleControl* m_httpSampler;
    SampleControl* m_videoSampler;
    SampleControl* m_audioSampler;
    DataWriter* m_dataWriter;
    std::string m_version;
    std::string m_name;
    FilterManager* m_manager;
    bool m_logHttp;
    bool m_logHttpObj;
    mutex m_guidMutex;  // guards m_guidCounter and m_lastGuid
    uint32_t m_guidCounter;
    std::string m_lastGuid;
    int m_logPercent;
    int m_factor;
    bool m_skipMode;
    int m_random;
    char m_delimiter;
    char m_subChar;
    // Read once: the process id is part of every GUID and never changes.
    unsigned long m_processId;
    // The clock of the GUIDs (the system clock; tests fix it).
    time_t (*m_clock)(time_t*);

    friend struct DataHandlerTestAccess;
};

#endif

#include "mdhandler.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>
#include <unistd.h>

#include "mcfg.h"
#include "mdwriter.h"
#include "mfmgr.h"
#include "murl.h"

static TRC1_CUB s_unit = TRC1_UNIT_INIT("mdhandler");

const char RDType_Defined[16][5] = {"NONE", "TCP ", "UDP ", "NONE", "HTTP", "MSVD", "REAL", "QTIM",
                                    "QOLB", "MSAU", "RLAU", "QOLC", "MALR", "PKTS", "CTXT", "STAT"};

namespace {

const char TYPE_HTTP[] = "HTTP";
const char NO_TITLE[] = "NO_TITLE_FOUND";
const char* const VIDEO_CODES[] = {"MSVD", "REAL", "QTIM"};
const char* const AUDIO_CODES[] = {"MSAU", "RLAU"};
// A GUID has at most this many characters; longer ones are cut.
const size_t GUID_MAX = 64;

// rdType is four characters without a terminator.
bool isType(const ZUB_RESPONSE_TIME_DATA* entry, const char* code)
{
    return memcmp(entry->rdType, code, sizeof(entry->rdType)) == 0;
}

const char* orNA(const char* text)
{
    return text != nullptr && text[0] != '\0' ? text : NA;
}

const char* orNA(const std::string& text)
{
    return text.empty() ? NA : text.c_str();
}

// Length of an inline text that may fill its field without a terminator,
// as a printf precision.
template <size_t N>
int fieldLength(const char (&field)[N])
{
    return static_cast<int>(strnlen(field, N));
}

// The piece of `text` (of `length` characters) from `start`, at most
// `limit` characters; empty when the text is shorter than `start`.
int cutLength(int length, int start, int limit)
{
    if (length <= start)
        return 0;
    return length - start < limit ? length - start : limit;
}

// Where the next piece of a record goes: at `used` while that lies inside
// the buffer, else at its end with no room, so that the piece is only
// measured.
char* pieceAt(char* buffer, size_t size, size_t used)
{
    return used < size ? buffer + used : buffer + size;
}

size_t roomAt(size_t size, size_t used)
{
    return used < size ? size - used : 0;
}

}  // namespace

int typeLookup(const char* code)
{
    if (code == nullptr)
        return 0;
    for (int i = 4; i < 16; ++i)
        if (strncmp(code, RDType_Defined[i], 4) == 0)
            return i;
    return 0;
}

void replace(char* text, char from, char to)
{
    // A NUL `from` would find the terminator and run on past it.
    if (text == nullptr || from == '\0')
        return;
    for (char* at = strchr(text, from); at != nullptr; at = strchr(at + 1, from))
        *at = to;
}

void replace(char* text, size_t size, char from, char to)
{
    if (text == nullptr || from == '\0')
        return;
    for (size_t i = 0; i < size && text[i] != '\0'; ++i)
        if (text[i] == from)
            text[i] = to;
}

// ---------------------------------------------------------------- sampling

SampleControl::SampleControl(int logPercent, int factor, bool skipMode)
    : m_logPercent(logPercent), m_count(0), m_factor(factor), m_skipMode(skipMode), m_samplesActive(true), m_lock()
{
}

bool SampleControl::checkSampling()
{
    // m_logPercent never changes, so the common case needs no lock.
    if (m_logPercent >= 100)
        return true;

    scoped_lock lock(m_lock, true);
    ++m_count;
    if (m_skipMode) {
        if (m_count < m_factor) {
            m_samplesActive = true;
            return true;
        }
        m_count = 0;
        m_samplesActive = false;
        return false;
    }
    if (m_count == 1) {
        m_samplesActive = true;
        return true;
    }
    if (m_count >= m_factor)
        m_count = 0;
    m_samplesActive = false;
    return false;
}

bool SampleControl::logSamplesActive()
{
    scoped_lock lock(m_lock, true);
    return m_samplesActive;
}

// ------------------------------------------------------------ construction

DataHandler::DataHandler(FilterManager* manager)
    : m_httpSampler(nullptr), m_videoSampler(nullptr), m_audioSampler(nullptr), m_dataWriter(nullptr),
      m_version(), m_name(), m_manager(manager), m_logHttp(false), m_logHttpObj(false), m_guidMutex(),
      m_guidCounter(0), m_lastGuid(), m_logPercent(100), m_factor(100), m_skipMode(true), m_random(0),
      m_delimiter('^'), m_subChar('_'), m_processId(static_cast<unsigned long>(getpid())), m_clock(&time)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "DataHandler::DataHandler");
    const int mask = trc1Mask(&blk);
    const bool entered = (mask & TRC_FLOW) != 0;
    if (entered)
        TRC1_Event(&blk, __LINE__, TRC1_ENTRY);

    if (m_manager != nullptr) {
        const Config* config = m_manager->getConfig();
        m_name = config->getName();
        m_version = config->getVersion();
        m_logHttp = config->logHttp();
        m_logHttpObj = config->logHttpObj();
        try {
            m_dataWriter = new DataWriter(config->getLogDir(), config->getLogSuffix(), config->getKeepDays(),
                                          config->getLogMaxSize());
            m_delimiter = config->getDelimiter();
            m_subChar = config->getSubChar();
            m_logPercent = config->getLogPercent();
            calculateLogPercent();
            m_httpSampler = new SampleControl(m_logPercent, m_factor, m_skipMode);
            m_videoSampler = new SampleControl(m_logPercent, m_factor, m_skipMode);
            m_audioSampler = new SampleControl(m_logPercent, m_factor, m_skipMode);
        } catch (...) {
            // The destructor does not run for a half-built handler.
            delete m_videoSampler;
            delete m_httpSampler;
            delete m_dataWriter;
            throw;
        }
    }

    srand(static_cast<unsigned>(time(nullptr)));
    m_random = rand();

    if (entered)
        TRC1_Event(&blk, __LINE__, TRC1_EXIT);
}

DataHandler::~DataHandler()
{
    delete m_dataWriter;
    delete m_httpSampler;
    delete m_videoSampler;
    delete m_audioSampler;
}

void DataHandler::calculateLogPercent()
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "DataHandler::calculateLogPercent");
    const int mask = trc1Mask(&blk);

    const int p = m_logPercent;
    if (p == 0) {
        m_logPercent = 100;
        return;
    }

    m_skipMode = true;
    if (p >= 99)
        m_factor = 100;
    else if (p >= 98)
        m_factor = 50;
    else if (p >= 97)
        m_factor = 34;
    else if (p >= 96)
        m_factor = 25;
    else if (p >= 95)
        m_factor = 20;
    else if (p >= 90)
        m_factor = 10;
    else if (p >= 85)
        m_factor = 7;
    else if (p >= 80)
        m_factor = 5;
    else if (p >= 70)
        m_factor = 4;
    else if (p >= 60)
        m_factor = 3;
    else if (p >= 45)
        m_factor = 2;
    else {
        // Below 45 % only the first record of each group passes.
        m_skipMode = false;
        if (p >= 30)
            m_factor = 3;
        else if (p >= 25)
            m_factor = 4;
        else if (p >= 20)
            m_factor = 5;
        else if (p >= 15)
            m_factor = 6;
        else if (p >= 10)
            m_factor = 10;
        else if (p >= 7)
            m_factor = 14;
        else if (p >= 6)
            m_factor = 16;
        else if (p >= 5)
            m_factor = 20;
        else if (p >= 4)
            m_factor = 25;
        else if (p >= 3)
            m_factor = 33;
        else if (p >= 2)
            m_factor = 50;
        else if (p >= 1)
            m_factor = 100;
    }

    if (mask & TRC_DETAIL)
        TRC1_Printf(&blk, __LINE__, "log pct = %d factor = %d skipMode = %s", p, m_factor,
                    m_skipMode ? "true" : "false");
}

// -------------------------------------------------------------------- GUID

std::string DataHandler::generateGuid()
{
    const time_t now = m_clock(nullptr);
    char text[GUID_MAX + 1] = {0};

    scoped_lock lock(m_guidMutex, true);
    const uint32_t counter = m_guidCounter++;
    snprintf(text, sizeof(text), "%lx%llx%x%08x%s", m_processId, static_cast<unsigned long long>(now),
             static_cast<unsigned>(m_random), static_cast<unsigned>(counter), m_name.c_str());
    m_lastGuid = text;
    return m_lastGuid;
}

std::string DataHandler::getGuid()
{
    std::string last;
    {
        scoped_lock lock(m_guidMutex, true);
        last = m_lastGuid;
    }
    if (!last.empty())
        return last;
    return generateGuid();
}

// ------------------------------------------------------------ record pieces

int DataHandler::addHeader(char* buffer, size_t size, const char* tag, const std::string& guid)
{
    if (buffer == nullptr || tag == nullptr)
        return 0;
    const char d = m_delimiter;
    return snprintf(buffer, size, "<%s>%s%c%d%c0%c%s%c%s%c", tag, m_version.c_str(), d, WEBMEDIA_APPL_ID, d, d,
                    m_name.c_str(), d, guid.c_str(), d);
}

int DataHandler::addCommon(char* buffer, size_t size, ZUB_RESPONSE_TIME_DATA* entry)
{
    if (buffer == nullptr || entry == nullptr)
        return 0;
    const char d = m_delimiter;
    // Columns 2 and 3 are cut from the stamp: up to 10 characters from
    // position 4 and up to 8 from position 15; a short stamp gives what
    // is there.
    const int stampLength = fieldLength(entry->stampText);
    return snprintf(buffer, size,
                    "%lu%c%.*s%c%.*s%c%d%c%.*s%c%.*s%c%u%c%.*s%c%u%c%d%c%d%c%d%c%d%c%d%c%ld%c%ld%c%ld%c",
                    static_cast<unsigned long>(entry->ulongValue), d, cutLength(stampLength, 4, 10),
                    entry->stampText + 4, d, cutLength(stampLength, 15, 8), entry->stampText + 15, d,
                    static_cast<int>(entry->intValue), d, fieldLength(entry->textA), entry->textA, d,
                    fieldLength(entry->textB), entry->textB, d, static_cast<unsigned>(entry->ushortA), d,
                    fieldLength(entry->textC), entry->textC, d, static_cast<unsigned>(entry->ushortB), d,
                    static_cast<int>(entry->intMetric1), d, static_cast<int>(entry->intMetric2), d,
                    static_cast<int>(entry->intMetric3), d, static_cast<int>(entry->intMetric4), d,
                    static_cast<int>(entry->intMetric5), d, static_cast<long>(entry->longMetric1), d,
                    static_cast<long>(entry->longMetric2), d, static_cast<long>(entry->longMetric3), d);
}

int DataHandler::addHttpMain(char* buffer, size_t size, ZUB_RESPONSE_TIME_DATA* entry)
{
    if (buffer == nullptr || entry == nullptr)
        return 0;
    ResponseTimeDetail& detail = entry->detail;
    ZUB_HTTP_DETAIL& http = detail.view.http;
    char* url = zubText(entry, detail.url);
    char* text1 = zubText(entry, detail.detailText1);
    char* text2 = zubText(entry, detail.detailText2);
    char* text3 = zubText(entry, detail.detailText3);
    char* title = zubText(entry, http.title);

    const char d = m_delimiter;
    replace(url, d, m_subChar);
    replace(text1, d, m_subChar);
    replace(text2, d, m_subChar);
    replace(text3, d, m_subChar);
    replace(http.httpText, sizeof(http.httpText), d, m_subChar);
    replace(title, d, m_subChar);

    const Wq5Url parts(url);

    // Compared after the substitution: when '_' is the delimiter, the
    // marker no longer reads NO_TITLE_FOUND and is written as a title.
    const char* titleText = orNA(title);
    if (strcmp(titleText, NO_TITLE) == 0)
        titleText = NA;

    const int httpTextLength = fieldLength(http.httpText);
    const char* httpText = httpTextLength > 0 ? http.httpText : NA;
    const int httpTextShown = httpTextLength > 0 ? httpTextLength : static_cast<int>(sizeof(NA) - 1);

    return snprintf(buffer, size,
                    "%s%c%s%c%s%c%s%c%.*s%c%d%c%d%c%d%c%d%c%d%c%d%c%d%c%d%c%d%c%d%c%d%c%d%c%s%c%s%c%s%c%s%c%s%c%s%c%d",
                    orNA(parts.getPartialForm()), d, orNA(text1), d, orNA(text2), d, orNA(text3), d, httpTextShown,
                    httpText, d, static_cast<int>(http.httpInt1), d, static_cast<int>(http.httpInt2), d,
                    static_cast<int>(http.httpInt3), d, static_cast<int>(http.httpInt4), d,
                    static_cast<int>(http.httpInt8), d, static_cast<int>(http.httpInt9), d,
                    static_cast<int>(http.httpInt10), d, static_cast<int>(http.httpInt11), d,
                    static_cast<int>(http.httpInt12), d, static_cast<int>(http.httpInt7), d,
                    static_cast<int>(http.httpInt6), d, static_cast<int>(http.httpInt5), d, orNA(parts.getHost()), d,
                    orNA(parts.getPath()), d, orNA(parts.getFile()), d, orNA(parts.getQuery()), d,
                    orNA(parts.getRef()), d, titleText, d, static_cast<int>(http.httpInt0));
}

int DataHandler::addHttpObj(char* buffer, size_t size, ZUB_RESPONSE_TIME_DATA* entry)
{
    return addHttpMain(buffer, size, entry);
}

int DataHandler::addHttpSummary(char* buffer, size_t size, ZUB_RESPONSE_TIME_DATA* entry)
{
    return addHttpMain(buffer, size, entry);
}

int DataHandler::addMedia(char* buffer, size_t size, ZUB_RESPONSE_TIME_DATA* entry)
{
    if (buffer == nullptr || entry == nullptr)
        return 0;
    const ResponseTimeDetail& detail = entry->detail;
    const ZUB_MEDIA_DETAIL& media = detail.view.media;
    const char d = m_delimiter;
    const int mediaTextLength = fieldLength(media.mediaText);
    const char* mediaText = mediaTextLength > 0 ? media.mediaText : NA;
    const int mediaTextShown = mediaTextLength > 0 ? mediaTextLength : static_cast<int>(sizeof(NA) - 1);
    return snprintf(buffer, size, "%d%c%s%c%s%c%s%c%s%c%.*s%c%d%c%d%c%d", typeLookup(entry->rdType), d,
                    orNA(zubText(entry, detail.url)), d, orNA(zubText(entry, detail.detailText1)), d,
                    orNA(zubText(entry, detail.detailText2)), d, orNA(zubText(entry, detail.detailText3)), d,
                    mediaTextShown, mediaText, d, static_cast<int>(media.mediaInt0), d,
                    static_cast<int>(media.mediaInt1), d, static_cast<int>(media.mediaInt2));
}

int DataHandler::addFooter(char* buffer, size_t size, const char* tag)
{
    if (buffer == nullptr || tag == nullptr)
        return 0;
    return snprintf(buffer, size, "</%s>\n", tag);
}

// ------------------------------------------------------------ whole records

int64_t DataHandler::formatHttpRecord(char* buffer, size_t size, const char* tag, const std::string& guid,
                                      ZUB_RESPONSE_TIME_DATA* entry)
{
    size_t used = 0;
    int n = addHeader(buffer, size, tag, guid);
    if (n < 0)
        return -1;
    used += static_cast<size_t>(n);
    if ((n = addCommon(pieceAt(buffer, size, used), roomAt(size, used), entry)) < 0)
        return -1;
    used += static_cast<size_t>(n);
    if ((n = addHttpMain(pieceAt(buffer, size, used), roomAt(size, used), entry)) < 0)
        return -1;
    used += static_cast<size_t>(n);
    if ((n = addFooter(pieceAt(buffer, size, used), roomAt(size, used), tag)) < 0)
        return -1;
    used += static_cast<size_t>(n);
    return static_cast<int64_t>(used);
}

int64_t DataHandler::formatMediaRecord(char* buffer, size_t size, const char* tag, const std::string& guid,
                                       ZUB_RESPONSE_TIME_DATA* entry)
{
    size_t used = 0;
    int n = addHeader(buffer, size, tag, guid);
    if (n < 0)
        return -1;
    used += static_cast<size_t>(n);
    if ((n = addCommon(pieceAt(buffer, size, used), roomAt(size, used), entry)) < 0)
        return -1;
    used += static_cast<size_t>(n);
    if ((n = addMedia(pieceAt(buffer, size, used), roomAt(size, used), entry)) < 0)
        return -1;
    used += static_cast<size_t>(n);
    if ((n = addFooter(pieceAt(buffer, size, used), roomAt(size, used), tag)) < 0)
        return -1;
    used += static_cast<size_t>(n);
    return static_cast<int64_t>(used);
}

void DataHandler::emitRecord(TRC1_EPB* blk, int mask, char* buffer, RecordFormat format, const char* tag,
                             const std::string& guid, ZUB_RESPONSE_TIME_DATA* entry)
{
    const int64_t length = (this->*format)(buffer, RECORD_BUFFER_SIZE, tag, guid, entry);
    if (length >= 0 && static_cast<uint64_t>(length) < RECORD_BUFFER_SIZE) {
        writeRecord(blk, mask, buffer, static_cast<size_t>(length));
        return;
    }

    // Too long for the call's buffer (texts of the library have no bound):
    // formatting is repeatable, so build the record again, whole, in a
    // buffer of its exact size rather than cut it.
    if (length < 0 || static_cast<uint64_t>(length) >= SIZE_MAX) {
        if (mask & TRC_ERROR)
            TRC1_Printf(blk, __LINE__, "Record with tag <%s> could not be formatted.", tag);
        return;
    }
    const size_t size = static_cast<size_t>(length) + 1;
    std::unique_ptr<char[]> large(new (std::nothrow) char[size]);
    if (!large || (this->*format)(large.get(), size, tag, guid, entry) != length) {
        if (mask & TRC_ERROR)
            TRC1_Printf(blk, __LINE__, "Record of <%lld> bytes with tag <%s> dropped.",
                        static_cast<long long>(length), tag);
        return;
    }
    writeRecord(blk, mask, large.get(), static_cast<size_t>(length));
}

void DataHandler::writeRecord(TRC1_EPB* blk, int mask, const char* record, size_t length)
{
    DataWriterLock lock(*m_dataWriter);
    FILE* stream = lock.getStream();
    if (stream == nullptr) {
        if (mask & TRC_ERROR)
            TRC1_Printf(blk, __LINE__, "Failed to open log file.");
        return;
    }
    if (fwrite(record, 1, length, stream) < length) {
        const int error = errno;
        if (mask & TRC_ERROR)
            TRC1_Printf(blk, __LINE__, "Write to log file failed %d", error);
    }
}

// ------------------------------------------------------------ table walks

bool DataHandler::stillRegistered(ZUB_RESPONSE_TIME_DATA_TABLE* table)
{
    // A handler built without a manager has no writer or samplers.
    if (m_dataWriter == nullptr)
        return false;
    // A table without an entry area has nothing to read, not even the flag.
    ZUB_RESPONSE_TIME_DATA* first = zubEntry(table, 0);
    if (first == nullptr)
        return false;
    if (first->registeredFlag == 0) {
        m_manager->disconnect();
        return false;
    }
    return true;
}

void DataHandler::processHttp(ZUB_RESPONSE_TIME_DATA_TABLE* table)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "DataHandler::processHttp");
    const int mask = trc1Mask(&blk);

    if (mask & TRC_DETAIL)
        TRC1_Printf(&blk, __LINE__, "processing table <%p>", static_cast<void*>(table));
    if (table == nullptr)
        return;
    if (mask & TRC_DETAIL)
        TRC1_Printf(&blk, __LINE__, "  total entries <%d>", static_cast<int>(table->entryCount));
    if (!stillRegistered(table))
        return;

    char buffer[RECORD_BUFFER_SIZE];
    // The GUID of the records; an object record carries that of the page
    // entry before it in this table. Tables of one kind arrive on several
    // threads at once, so the handler's last GUID and its page sampler's
    // latest decision may by then belong to another thread's page: they
    // are used only for objects with no page before them in their table
    // (and the decision also when that page was not sampled).
    std::string guid;
    bool pageSeen = false;
    bool pageSampled = false;
    bool pageActive = true;

    const int32_t count = table->entryCount;
    for (int32_t i = 0; i < count; ++i) {
        ZUB_RESPONSE_TIME_DATA* entry = zubEntry(table, i);
        if (!isType(entry, TYPE_HTTP))
            continue;
        const int entryType = entry->detail.view.http.httpEntryType;
        if (mask & TRC_DETAIL)
            TRC1_Printf(&blk, __LINE__, "  processing entry <%d> type <%d>", static_cast<int>(i), entryType);

        // The GUID is made or fetched before the switches and the sampler
        // are consulted, so every page moves the GUID counter on.
        const char* tag;
        if (entryType == 1) {
            guid = generateGuid();
            pageSeen = true;
            pageSampled = false;
            if (!m_logHttp)
                continue;
            pageActive = m_httpSampler->checkSampling();
            pageSampled = true;
            if (!pageActive)
                continue;
            tag = TAG_HTTPPAGE;
        } else if (entryType == 2) {
            if (!pageSeen)
                guid = getGuid();
            if (!m_logHttpObj)
                continue;
            const bool active = pageSampled ? pageActive : m_httpSampler->logSamplesActive();
            if (!active)
                continue;
            tag = TAG_HTTPOBJ;
        } else {
            continue;
        }

        if (mask & TRC_DETAIL) {
            TRC1_Printf(&blk, __LINE__, "    writing <%d> tag <%s>", static_cast<int>(i), tag);
            // Shows the URL before the delimiter in it is substituted.
            TRC1_Printf(&blk, __LINE__, "    url <%s>", orNA(zubText(entry, entry->detail.url)));
        }
        emitRecord(&blk, mask, buffer, &DataHandler::formatHttpRecord, tag, guid, entry);
    }
}

void DataHandler::processVideo(ZUB_RESPONSE_TIME_DATA_TABLE* table)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "DataHandler::processVideo");
    processMedia(&blk, trc1Mask(&blk), table, m_videoSampler, VIDEO_CODES,
                 static_cast<int>(sizeof(VIDEO_CODES) / sizeof(VIDEO_CODES[0])), TAG_VIDEO);
}

void DataHandler::processAudio(ZUB_RESPONSE_TIME_DATA_TABLE* table)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "DataHandler::processAudio");
    processMedia(&blk, trc1Mask(&blk), table, m_audioSampler, AUDIO_CODES,
                 static_cast<int>(sizeof(AUDIO_CODES) / sizeof(AUDIO_CODES[0])), TAG_AUDIO);
}

void DataHandler::processMedia(TRC1_EPB* blk, int mask, ZUB_RESPONSE_TIME_DATA_TABLE* table, SampleControl* sampler,
                               const char* const* codes, int codeCount, const char* tag)
{
    if (mask & TRC_DETAIL)
        TRC1_Printf(blk, __LINE__, "processing table <%p>", static_cast<void*>(table));
    if (table == nullptr || !stillRegistered(table))
        return;

    char buffer[RECORD_BUFFER_SIZE];
    std::string guid;
    const int32_t count = table->entryCount;
    for (int32_t i = 0; i < count; ++i) {
        ZUB_RESPONSE_TIME_DATA* entry = zubEntry(table, i);
        // Every entry counts for the sampler, whatever its type.
        if (!sampler->checkSampling())
            continue;
        bool accepted = false;
        for (int c = 0; c < codeCount && !accepted; ++c)
            accepted = isType(entry, codes[c]);
        if (!accepted)
            continue;

        ResponseTimeDetail& detail = entry->detail;
        replace(zubText(entry, detail.url), m_delimiter, m_subChar);
        replace(zubText(entry, detail.detailText1), m_delimiter, m_subChar);
        replace(zubText(entry, detail.detailText2), m_delimiter, m_subChar);
        replace(zubText(entry, detail.detailText3), m_delimiter, m_subChar);
        replace(detail.view.media.mediaText, sizeof(detail.view.media.mediaText), m_delimiter, m_subChar);

        guid = generateGuid();
        emitRecord(blk, mask, buffer, &DataHandler::formatMediaRecord, tag, guid, entry);
    }
}

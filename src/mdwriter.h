// Log file output: the file name of a UTC day (with a sequence number under
// a size limit), the writer that owns the one open log file, and the lock
// through which every record reaches it.
#ifndef WQ5_MDWRITER_H
#define WQ5_MDWRITER_H

#include <cstdint>
#include <cstdio>
#include <string>

#include "umutex.h"

// Seconds since the epoch. All times, period starts and thresholds are held
// in 64 bits, also on a 32-bit build.
typedef int64_t wq5_time_t;

// The clock the writer reads; null (the default) is the system clock. Tests
// set their own to step over midnight; the production path never sets it.
// May be called at any time from any thread.
typedef wq5_time_t (*WriterClock)(void);
void setWriterClock(WriterClock clock);

// The calls through which a record reaches its file: the write, the flush,
// and the cut that takes a failed record off again. Tests set their own to
// inject faults (errors, short writes, failing flushes and cuts) into the
// real write path; a null member is the system's own call. Set only while
// no record is being written; the production path never sets it.
struct WriterIo {
    typedef size_t (*WriteCall)(const void* data, size_t size, size_t count, FILE* stream);
    typedef int (*FlushCall)(FILE* stream);
    typedef int (*TruncateCall)(int fd, int64_t length);
    WriteCall write;
    FlushCall flush;
    TruncateCall truncate;
};
void setWriterIo(const WriterIo& io);

// Start of the current period of `period` seconds (> 0), periods aligned
// on the epoch; reads the writer's clock once.
wq5_time_t calcPeriodStart(wq5_time_t period);
// Replaces `out` with the UTC date of `t` as "%Y%m%d"; leaves it unchanged
// when the time cannot be broken down.
void time2str(wq5_time_t t, std::string& out);
// The sequence number in a log file path such as "log/20240305.12.wq5", or 0
// when the name has no (valid, int-sized) number. `path` must be writable:
// the dot after the digits is overwritten for a moment and then restored.
int parseSeq(char* path, const char* suffix);

class DataWriter : private noncopyable {
public:
    // Opens nothing and traces nothing; appends "/" to `logDir` when it
    // lacks one (an empty `logDir` means the working directory, "./").
    // `keepDays` <= 0 keeps every file; `maxSizeMb` <= 0 sets no size limit.
    DataWriter(const std::string& logDir, const std::string& suffix, long keepDays, long maxSizeMb);
    // Closes the open file. Takes no lock: no record writer may be left.
    ~DataWriter();

    // Brings the log file up to date for a record (first open, new day,
    // size limit, open file removed, retry after a failed open). Returns -1
    // when it tried to open a file and failed (the stream is then null),
    // else 0. Caller holds the writer's mutex (through DataWriterLock).
    int checkAndOpen();
    // Flushes the stream; it stays open. Caller holds the writer's mutex.
    void release();

    // The path of the file to open for the period starting at `periodStart`:
    // the day's latest file, or the next number when that one is over the
    // size limit. Never fails; a missing directory gives the unnumbered name.
    void getLogfileName(wq5_time_t periodStart, std::string& name);
    // Deletes log files whose name sorts before the date `m_keepDays` days
    // before `periodStart`. Failures end the pass quietly (one traced).
    void deleteOldFiles(wq5_time_t periodStart);

    // Tests only, before the first record: the size limit in bytes instead
    // of megabytes (0 or less = none).
    void setMaxSizeBytes(int64_t bytes);

private:
    friend class DataWriterLock;

    // Closes the current file, names the next one, prunes, opens it.
    int reopen(wq5_time_t periodStart, wq5_time_t now);
    // True when the open file must be replaced: it has been removed, or it
    // is over the size limit. One fstat per record with a limit, at most
    // one a second without; each refreshes m_fileSize.
    bool openFileStale(wq5_time_t now);
    // Closes the open file, if any, after a last try to cut off what a
    // failed record left behind.
    void closeStream();
    // See DataWriterLock::writeRecord. Caller holds the writer's mutex.
    bool writeRecord(const char* data, size_t length);
    // Cuts the open file back to m_cutTo when a failed record left bytes
    // behind; true when nothing is left to cut.
    bool cutBack();
    // Counts a dropped record; returns false with errno set to `error`.
    bool recordLost(int error);
    // True when the file `name` exists and is larger than the size limit.
    bool overLimit(const std::string& name) const;
    // The path of sequence number `seq` of the day `date`.
    std::string buildName(const std::string& date, int seq) const;

    mutex m_mutex;
    FILE* m_stream;
    wq5_time_t m_openPeriod;
    std::string m_logDir;
    std::string m_suffix;
    long m_keepDays;
    long m_maxSizeMb;
    uint32_t m_openErrors;
    int64_t m_maxSizeBytes;     // m_maxSizeMb in bytes, saturated; 0 = no limit
    std::string m_fileName;     // path of the open file
    int64_t m_fileSize;         // size of the open file; -1 = unknown
    wq5_time_t m_statusCheck;   // time of the last fstat of the open file
    int64_t m_cutTo;            // size the open file must be cut back to; -1 = none
    unsigned long m_lostRecords;  // records dropped since writing last succeeded
};

// Holds the writer's mutex for one record and brings the file up to date.
// The way to the file: construct, writeRecord (or getStream and one write
// of the whole record), destroy. Never construct one inside the writer's
// own operations (the mutex is not recursive).
class DataWriterLock {
public:
    // Locks (lock_error propagates and checkAndOpen is not called), then
    // runs checkAndOpen.
    explicit DataWriterLock(DataWriter& writer);
    // Flushes (release) and unlocks.
    ~DataWriterLock();
    // The open log file, or null when none could be opened: the record is
    // then dropped. Owned by the writer; never close it.
    FILE* getStream();
    // Writes the whole record with one write and flushes it: true when both
    // succeeded. False when the record was dropped: no file is open, the
    // remains of an earlier failed record could not be cut off, or the
    // write or the flush failed; errno then holds the error number (it is
    // unspecified when no file is open). Whatever part of a failed record
    // reached the file is cut off again, so that the file ends on a whole
    // record. Dropped records are counted, and the next record written
    // traces their number.
    bool writeRecord(const char* data, size_t length);

private:
    DataWriterLock(const DataWriterLock&) = delete;
    DataWriterLock& operator=(const DataWriterLock&) = delete;

    scoped_lock m_lock;
    DataWriter* m_writer;
};

#endif

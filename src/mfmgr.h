// The process-wide filter manager: owns the registration with the collection
// library, the filters, the settings and the data handler, and receives the
// library's tables through three plain callback functions.
//
// Threads: the control thread creates the singleton and calls connect();
// the library's threads call the callbacks; the main thread destroys the
// singleton after the control thread has ended.
#ifndef WQ5_MFMGR_H
#define WQ5_MFMGR_H

#include <atomic>
#include <cstdint>
#include <vector>

#include "mcfg.h"
#include "mfilter.h"
#include "ucountedptr.h"
#include "umutex.h"
#include "zub/zub1rt.h"

class DataHandler;

// Callbacks handed to the library; each passes its table to the manager.
void gotHttpPage(void* table);
void gotVideo(void* table);
void gotAudio(void* table);

class FilterManager {
public:
    // The singleton, created on first use (by the control thread, before
    // any registration exists; not locked).
    static FilterManager* instance();
    // Destroys the singleton, if any: unregisters, waits until no callback
    // is running inside the collector, deletes the data handler.
    static void destroyInstance();

    bool isConnected() const { return m_applId.load() != 0; }

    // Registers (when not registered) and defines every filter. Returns the
    // registration status; 0 on success.
    int connect();
    // Drops the registration; the control loop registers again later.
    // Returns the library's unregistration status, 0 when not registered.
    int disconnect();

    // The new filter, appended to the list, or null when it cannot be made.
    Filter* createFilter(unsigned short proto, unsigned short serv, void (*callback)(void*));
    int define(Filter& filter);
    int undefine(Filter& filter);
    void defineAll();
    void undefineAll();

    Config* getConfig() { return &m_config; }

    // Hand a table to the data handler, then give it back to the library.
    void processHttp(ZUB_RESPONSE_TIME_DATA_TABLE* table);
    void processVideo(ZUB_RESPONSE_TIME_DATA_TABLE* table);
    void processAudio(ZUB_RESPONSE_TIME_DATA_TABLE* table);

private:
    FilterManager();
    ~FilterManager();
    FilterManager(const FilterManager&) = delete;
    FilterManager& operator=(const FilterManager&) = delete;

    void init();
    // Hands the table to one of the handler's operations and gives it back
    // to the library, also when the handler throws.
    void handOver(void (DataHandler::*operation)(ZUB_RESPONSE_TIME_DATA_TABLE*),
                  ZUB_RESPONSE_TIME_DATA_TABLE* table);

    // Atomic because isConnected() and disconnect() read it without the
    // lock while the control thread writes it.
    std::atomic<uint32_t> m_applId;
    std::vector<counted_ptr<Filter>> m_filters;
    Config m_config;
    DataHandler* m_dataHandler;
    mutex m_mutex;

    static FilterManager* m_mgr;
};

#endif

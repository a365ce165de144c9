// Turns the response-time data tables of the callbacks into log records.
#ifndef WQ5_MDHANDLER_H
#define WQ5_MDHANDLER_H

#include "zub/zub1rt.h"

class FilterManager;

class DataHandler {
public:
    explicit DataHandler(FilterManager* manager);
    ~DataHandler();

    void processHttp(ZUB_RESPONSE_TIME_DATA_TABLE* table);
    void processVideo(ZUB_RESPONSE_TIME_DATA_TABLE* table);
    void processAudio(ZUB_RESPONSE_TIME_DATA_TABLE* table);

private:
    DataHandler(const DataHandler&) = delete;
    DataHandler& operator=(const DataHandler&) = delete;

    // True when the table has entries to walk; disconnects the collector
    // when its first entry says the registration is gone.
    bool stillRegistered(ZUB_RESPONSE_TIME_DATA_TABLE* table);

    FilterManager* m_manager;
};

#endif

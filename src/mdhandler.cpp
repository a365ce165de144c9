#include "mdhandler.h"

#include "mfmgr.h"

DataHandler::DataHandler(FilterManager* manager) : m_manager(manager) {}

DataHandler::~DataHandler() {}

bool DataHandler::stillRegistered(ZUB_RESPONSE_TIME_DATA_TABLE* table)
{
    if (table == nullptr)
        return false;
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
    stillRegistered(table);
}

void DataHandler::processVideo(ZUB_RESPONSE_TIME_DATA_TABLE* table)
{
    stillRegistered(table);
}

void DataHandler::processAudio(ZUB_RESPONSE_TIME_DATA_TABLE* table)
{
    stillRegistered(table);
}

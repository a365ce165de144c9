#include "mfmgr.h"

#include <condition_variable>
#include <cstring>
#include <exception>
#include <memory>
#include <mutex>

#include "mdhandler.h"
#include "platform/moq.h"
#include "zub/zub1api.h"

static TRC1_CUB s_unit = TRC1_UNIT_INIT("mfmgr");

FilterManager* FilterManager::m_mgr = nullptr;

namespace {

// Callbacks currently running inside the collector. A callback that drops
// the registration itself is no longer covered by the library's promise
// that unregistration waits for running callbacks, so the manager counts
// them and is torn down only when none is left.
std::mutex g_callbackLock;
std::condition_variable g_callbacksDone;
int g_callbacksRunning = 0;

class CallbackScope {
public:
    CallbackScope()
    {
        std::lock_guard<std::mutex> guard(g_callbackLock);
        ++g_callbacksRunning;
    }
    ~CallbackScope()
    {
        std::lock_guard<std::mutex> guard(g_callbackLock);
        if (--g_callbacksRunning == 0)
            g_callbacksDone.notify_all();
    }
    CallbackScope(const CallbackScope&) = delete;
    CallbackScope& operator=(const CallbackScope&) = delete;
};

void waitForCallbacks()
{
    std::unique_lock<std::mutex> guard(g_callbackLock);
    g_callbacksDone.wait(guard, [] { return g_callbacksRunning == 0; });
}

ZUB_FILTER_REQUEST makeRequest(const Filter& filter, bool remove)
{
    ZUB_FILTER_REQUEST request;
    std::memset(&request, 0, sizeof(request));
    request.level = ZUB_REQ_LEVEL;
    if (remove) {
        request.requestType = ZUB_REQ_REMOVE_FILTER;
        request.filterId = filter.m_filterId;
    } else {
        request.requestType = ZUB_REQ_DEFINE_FILTER;
        request.flags = ZUB_REQ_FLAG_CALLBACK;
        request.service = filter.m_serv;
        request.protocol = filter.m_proto;
        request.callback = filter.m_callback;
    }
    return request;
}

// The three callbacks share this: a table is given back whatever happens,
// and no exception crosses into the library's thread.
void deliver(void (FilterManager::*process)(ZUB_RESPONSE_TIME_DATA_TABLE*), void* table)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "FilterManager::callback");
    CallbackScope running;
    ZUB_RESPONSE_TIME_DATA_TABLE* rt = static_cast<ZUB_RESPONSE_TIME_DATA_TABLE*>(table);
    FilterManager* manager = nullptr;
    try {
        manager = FilterManager::instance();
    } catch (const std::exception& e) {
        if (trc1Mask(&blk) & TRC_ERROR)
            TRC1_Printf(&blk, __LINE__, "Error: table <%p> not processed: %s", table, e.what());
        ZUB1_FreeResponseTimeResult(table);
        return;
    }
    (manager->*process)(rt);
}

}  // namespace

void gotHttpPage(void* table)
{
    deliver(&FilterManager::processHttp, table);
}

void gotVideo(void* table)
{
    deliver(&FilterManager::processVideo, table);
}

void gotAudio(void* table)
{
    deliver(&FilterManager::processAudio, table);
}

FilterManager* FilterManager::instance()
{
    if (m_mgr == nullptr)
        m_mgr = new FilterManager();
    return m_mgr;
}

void FilterManager::destroyInstance()
{
    if (m_mgr != nullptr)
        delete m_mgr;
    m_mgr = nullptr;
}

FilterManager::FilterManager() : m_applId(0), m_filters(), m_config(), m_dataHandler(nullptr), m_mutex()
{
    try {
        init();
    } catch (...) {
        delete m_dataHandler;
        throw;
    }
}

FilterManager::~FilterManager()
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "FilterManager::~FilterManager");
    try {
        disconnect();
    } catch (const std::exception& e) {
        if (trc1Mask(&blk) & TRC_ERROR)
            TRC1_Printf(&blk, __LINE__, "Error: unregistration failed: %s", e.what());
    }
    waitForCallbacks();
    delete m_dataHandler;
}

void FilterManager::init()
{
    m_dataHandler = new DataHandler(this);
    if (m_config.logHttp() || m_config.logHttpObj())
        createFilter(0, 80, gotHttpPage);
    if (m_config.logHttpSecure())
        createFilter(0, 443, gotHttpPage);
    if (m_config.logMSVideo())
        createFilter(1, 0, gotVideo);
    if (m_config.logMSAudio())
        createFilter(5, 0, gotAudio);
    if (m_config.logRealVideo())
        createFilter(2, 0, gotVideo);
    if (m_config.logRealAudio())
        createFilter(6, 0, gotAudio);
    if (m_config.logQuickTime())
        createFilter(3, 0, gotVideo);
}

Filter* FilterManager::createFilter(unsigned short proto, unsigned short serv, void (*callback)(void*))
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "FilterManager::createFilter");
    try {
        std::unique_ptr<Filter> made(new Filter(proto, serv, callback));
        counted_ptr<Filter> owned(made.get());
        made.release();
        scoped_lock lock(m_mutex, true);
        m_filters.push_back(owned);
        return owned.get();
    } catch (...) {
        if (trc1Mask(&blk) & TRC_ERROR)
            TRC1_Printf(&blk, __LINE__, "Unable to create filter proto <%d> serv <%d>", proto, serv);
        return nullptr;
    }
}

int FilterManager::connect()
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "FilterManager::connect");
    const int mask = trc1Mask(&blk);
    scoped_lock lock(m_mutex, true);

    if (m_applId.load() != 0) {
        // Defining the filters a second time would only duplicate them.
        if (mask & TRC_DETAIL)
            TRC1_Printf(&blk, __LINE__, "already connected.");
        return 0;
    }

    if (mask & TRC_DETAIL)
        TRC1_Printf(&blk, __LINE__, "connecting...");
    const std::string name = m_config.getName();
    ZUB_APPL_ID id = 0;
    const int rc = ZUB1_RegisterApplication(&id, name.c_str(), 0, 0);
    if (rc == 0) {
        m_applId.store(id);
        defineAll();
        if (mask & TRC_DETAIL)
            TRC1_Printf(&blk, __LINE__, "connection successful id = <%d>", static_cast<int>(id));
    } else if (mask & TRC_DETAIL) {
        TRC1_Printf(&blk, __LINE__, "unable to connect.  rc = <%d>", rc);
    }
    return rc;
}

int FilterManager::disconnect()
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "FilterManager::disconnect");
    const int mask = trc1Mask(&blk);
    if (mask & TRC_DETAIL)
        TRC1_Printf(&blk, __LINE__, "disconnecting id = <%d>", static_cast<int>(m_applId.load()));

    ZUB_APPL_ID id;
    {
        scoped_lock lock(m_mutex, true);
        id = m_applId.exchange(0);
    }

    // Outside the lock: unregistration waits for running callbacks, and one
    // of them may be waiting for this mutex in its own disconnect.
    int rc = 0;
    if (id != 0) {
        rc = ZUB1_UnregisterApplication(&id);
        if (mask & TRC_DETAIL)
            TRC1_Printf(&blk, __LINE__, "unregistered rc <%d>", rc);
    }
    return rc;
}

int FilterManager::define(Filter& filter)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "FilterManager::define");
    int rc = 0;
    ZUB_APPL_ID id = m_applId.load();
    if (id != 0) {
        ZUB_FILTER_REQUEST request = makeRequest(filter, false);
        rc = ZUB1_DefineFilter(&id, &request);
        if (trc1Mask(&blk) & TRC_DETAIL)
            TRC1_Printf(&blk, __LINE__, "DefineFilter proto <%d> serv <%d> rc <%d>", filter.m_proto, filter.m_serv, rc);
    }
    return rc;
}

int FilterManager::undefine(Filter& filter)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "FilterManager::undefine");
    int rc = 0;
    ZUB_APPL_ID id = m_applId.load();
    if (id != 0) {
        ZUB_FILTER_REQUEST request = makeRequest(filter, true);
        rc = ZUB1_DefineFilter(&id, &request);
        if (trc1Mask(&blk) & TRC_DETAIL)
            TRC1_Printf(&blk, __LINE__, "DefineFilter proto <%d> serv <%d> rc <%d>", filter.m_proto, filter.m_serv, rc);
    }
    return rc;
}

void FilterManager::defineAll()
{
    if (m_applId.load() == 0)
        return;
    for (counted_ptr<Filter>& filter : m_filters)
        define(*filter);
}

void FilterManager::undefineAll()
{
    if (m_applId.load() == 0)
        return;
    for (counted_ptr<Filter>& filter : m_filters)
        undefine(*filter);
}

void FilterManager::handOver(void (DataHandler::*operation)(ZUB_RESPONSE_TIME_DATA_TABLE*),
                             ZUB_RESPONSE_TIME_DATA_TABLE* table)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "FilterManager::handOver");
    try {
        if (m_dataHandler != nullptr)
            (m_dataHandler->*operation)(table);
    } catch (const std::exception& e) {
        if (trc1Mask(&blk) & TRC_ERROR)
            TRC1_Printf(&blk, __LINE__, "Error: table <%p> not processed: %s", static_cast<void*>(table), e.what());
    } catch (...) {
        if (trc1Mask(&blk) & TRC_ERROR)
            TRC1_Printf(&blk, __LINE__, "Error: table <%p> not processed: unknown exception", static_cast<void*>(table));
    }
    ZUB1_FreeResponseTimeResult(table);
}

void FilterManager::processHttp(ZUB_RESPONSE_TIME_DATA_TABLE* table)
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "FilterManager::processHttp");
    const int mask = trc1Mask(&blk);
    // The address is printed in full: on a 64-bit build "%08x" of a
    // truncated pointer would name the wrong area.
    const unsigned long address = static_cast<unsigned long>(reinterpret_cast<uintptr_t>(table));
    if (mask & TRC_DETAIL)
        TRC1_Printf(&blk, __LINE__, "Handling http callback answer area 0x%08lx", address);
    handOver(&DataHandler::processHttp, table);
    if (mask & TRC_DETAIL)
        TRC1_Printf(&blk, __LINE__, "Freeing  http callback answer area 0x%08lx", address);
}

void FilterManager::processVideo(ZUB_RESPONSE_TIME_DATA_TABLE* table)
{
    handOver(&DataHandler::processVideo, table);
}

void FilterManager::processAudio(ZUB_RESPONSE_TIME_DATA_TABLE* table)
{
    handOver(&DataHandler::processAudio, table);
}

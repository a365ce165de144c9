#include "mcfg.h"

#include <cstdlib>
#include <limits>
#include <unistd.h>

#include "platform/moq.h"

static TRC1_CUB s_unit = TRC1_UNIT_INIT("mcfg");

// The leading decimal number of `text`, as atoi and atol read it, but held
// to the range of the result type: atoi's result is undefined for a number
// that does not fit, and a keep-days value that wrapped to a small number
// would delete nearly every log file.
template <class Int>
static Int leadingNumber(const char* text)
{
    const long long value = strtoll(text, nullptr, 10);  // saturates on overflow
    if (value > std::numeric_limits<Int>::max())
        return std::numeric_limits<Int>::max();
    if (value < std::numeric_limits<Int>::min())
        return std::numeric_limits<Int>::min();
    return static_cast<Int>(value);
}

bool getBoolEnv(const char* name)
{
    const char* value = QEN1_GetEnv(name, DEFAULT_NO);
    return value[0] == 'Y' || value[0] == 'y';
}

Config::Config()
    : m_name(), m_logDir(), m_version("v121"), m_logSuffix("wq5"), m_keepDays(0), m_logPercent(0),
      m_logMaxSize(0), m_logHttp(false), m_logHttpObj(false), m_logHttpSecure(false), m_logMSVideo(false),
      m_logMSAudio(false), m_logRealVideo(false), m_logRealAudio(false), m_logQuickTime(false),
      m_delimiter('^'), m_subChar('_')
{
    static TRC1_EPB blk = TRC1_BLOCK_INIT(s_unit, "Config::Config");
    const int mask = trc1Mask(&blk);
    const bool entered = (mask & TRC_FLOW) != 0;
    if (entered)
        TRC1_Event(&blk, __LINE__, TRC1_ENTRY);

    const char* name = QEN1_GetEnv(OPT_NAME, nullptr);
    if (name != nullptr && name[0] != '\0') {
        m_name = name;
    } else {
        char host[256] = {0};
        // gethostname need not terminate a truncated name; the last byte
        // stays NUL.
        if (gethostname(host, sizeof(host) - 1) == 0)
            m_name = host;
        else
            m_name = DEFAULT_NAME;
    }

    m_logDir = QEN1_GetEnv(OPT_LOGDIR, DEFAULT_LOGDIR);
    m_keepDays = leadingNumber<int>(QEN1_GetEnv(OPT_KEEPDAYS, DEFAULT_KEEPDAYS));

    m_logPercent = leadingNumber<int>(QEN1_GetEnv(OPT_LOG_PCT, DEFAULT_LOG_PCT));
    if (m_logPercent < 0 || m_logPercent > 100) {
        if (mask & TRC_ERROR)
            TRC1_Printf(&blk, __LINE__, "%s value of %d corrected to 100", OPT_LOG_PCT, m_logPercent);
        m_logPercent = 100;
    }

    m_logMaxSize = leadingNumber<long>(QEN1_GetEnv(OPT_LOG_MAX_SIZE, DEFAULT_LOG_MAX_SIZE));

    m_logHttp = getBoolEnv(OPT_LOG_HTTP);
    m_logHttpObj = getBoolEnv(OPT_LOG_HTTPOBJ);
    m_logHttpSecure = getBoolEnv(OPT_LOG_HTTPSECURE);
    m_logMSVideo = getBoolEnv(OPT_LOG_MSV);
    m_logMSAudio = getBoolEnv(OPT_LOG_MSA);
    m_logRealVideo = getBoolEnv(OPT_LOG_RV);
    m_logRealAudio = getBoolEnv(OPT_LOG_RA);
    m_logQuickTime = getBoolEnv(OPT_LOG_QT);

    m_delimiter = QEN1_GetEnv(OPT_FIELD_DELIMITER, DEFAULT_FIELD_DELIMITER)[0];
    m_subChar = QEN1_GetEnv(OPT_SUB_CHAR, DEFAULT_SUB_CHAR)[0];
    if (mask & TRC_DETAIL)
        TRC1_Printf(&blk, __LINE__, "delimiter <%c> sub char <%c>", m_delimiter, m_subChar);

    if (entered)
        TRC1_Event(&blk, __LINE__, TRC1_EXIT);
}

Config::~Config() = default;

// The collector's settings, read once from WQ5_ environment variables when
// the Config is constructed; there is no file and no re-reading.
#ifndef WQ5_MCFG_H
#define WQ5_MCFG_H

#include <string>

#define OPT_NAME "WQ5_COLLECTOR_ID"
#define DEFAULT_NAME "wq5coll"
#define OPT_LOGDIR "WQ5_LOG_DIR"
#define DEFAULT_LOGDIR "log"
#define OPT_KEEPDAYS "WQ5_LOG_KEEPDAYS"
#define DEFAULT_KEEPDAYS "7"
#define OPT_LOG_PCT "WQ5_LOG_SAMPLE_PERCENTAGE"
#define DEFAULT_LOG_PCT "100"
#define OPT_LOG_MAX_SIZE "WQ5_LOG_MAX_SIZE_MB"
#define DEFAULT_LOG_MAX_SIZE "0"
#define OPT_LOG_HTTP "WQ5_LOG_HTTP"
#define OPT_LOG_HTTPOBJ "WQ5_LOG_HTTPOBJ"
#define OPT_LOG_HTTPSECURE "WQ5_LOG_HTTPS"
#define OPT_LOG_MSV "WQ5_LOG_MS_VIDEO"
#define OPT_LOG_MSA "WQ5_LOG_MS_AUDIO"
#define OPT_LOG_RV "WQ5_LOG_REAL_VIDEO"
#define OPT_LOG_RA "WQ5_LOG_REAL_AUDIO"
#define OPT_LOG_QT "WQ5_LOG_QUICKTIME"
#define OPT_FIELD_DELIMITER "WQ5_FIELD_DELIMITER"
#define DEFAULT_FIELD_DELIMITER "^"
#define OPT_SUB_CHAR "WQ5_SUB_CHAR"
#define DEFAULT_SUB_CHAR "_"
#define DEFAULT_NO "N"

// True exactly when the variable's value starts with 'Y' or 'y' (default "N").
bool getBoolEnv(const char* name);

class Config {
public:
    Config();
    ~Config();

    const std::string getName() const { return m_name; }
    const std::string getLogDir() const { return m_logDir; }
    const std::string getVersion() const { return m_version; }
    const std::string getLogSuffix() const { return m_logSuffix; }
    long getKeepDays() const { return m_keepDays; }
    int getLogPercent() const { return m_logPercent; }
    long getLogMaxSize() const { return m_logMaxSize; }
    bool logHttp() const { return m_logHttp; }
    bool logHttpObj() const { return m_logHttpObj; }
    bool logHttpSecure() const { return m_logHttpSecure; }
    bool logMSVideo() const { return m_logMSVideo; }
    bool logMSAudio() const { return m_logMSAudio; }
    bool logRealVideo() const { return m_logRealVideo; }
    bool logRealAudio() const { return m_logRealAudio; }
    bool logQuickTime() const { return m_logQuickTime; }
    char getDelimiter() const { return m_delimiter; }
    char getSubChar() const { return m_subChar; }

private:
    std::string m_name;
    std::string m_logDir;
    std::string m_version;
    std::string m_logSuffix;
    int m_keepDays;
    int m_logPercent;
    long m_logMaxSize;
    bool m_logHttp;
    bool m_logHttpObj;
    bool m_logHttpSecure;
    bool m_logMSVideo;
    bool m_logMSAudio;
    bool m_logRealVideo;
    bool m_logRealAudio;
    bool m_logQuickTime;
    char m_delimiter;
    char m_subChar;
};

#endif

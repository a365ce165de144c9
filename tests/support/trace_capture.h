// Collects the trace lines written while it lives, with a chosen class mask.
#ifndef WQ5_TESTS_TRACE_CAPTURE_H
#define WQ5_TESTS_TRACE_CAPTURE_H

#include <mutex>
#include <string>
#include <vector>

#include "libmoq/moq_control.h"

class TraceCapture {
public:
    explicit TraceCapture(int mask) : m_oldMask(MOQ_GetMask())
    {
        MOQ_SetMask(mask);
        MOQ_SetSink(&TraceCapture::sink, this);
    }
    ~TraceCapture()
    {
        MOQ_SetSink(nullptr, nullptr);
        MOQ_SetMask(m_oldMask);
    }
    TraceCapture(const TraceCapture&) = delete;
    TraceCapture& operator=(const TraceCapture&) = delete;

    std::vector<std::string> lines() const
    {
        std::lock_guard<std::mutex> g(m_lock);
        return m_lines;
    }

    // Number of lines whose text ends with `text` (the message part of a
    // line comes last, before the newline).
    int count(const std::string& text) const
    {
        int n = 0;
        for (const std::string& line : lines())
            if (endsWith(line, text))
                ++n;
        return n;
    }

    // Index of the first line ending with `text`, or -1.
    int indexOf(const std::string& text) const
    {
        std::vector<std::string> all = lines();
        for (size_t i = 0; i < all.size(); ++i)
            if (endsWith(all[i], text))
                return static_cast<int>(i);
        return -1;
    }

private:
    static bool endsWith(const std::string& line, const std::string& text)
    {
        std::string body = line;
        if (!body.empty() && body.back() == '\n')
            body.pop_back();
        return body.size() >= text.size() && body.compare(body.size() - text.size(), text.size(), text) == 0;
    }

    static void sink(void* context, const char* line, size_t length)
    {
        TraceCapture* self = static_cast<TraceCapture*>(context);
        std::lock_guard<std::mutex> g(self->m_lock);
        self->m_lines.emplace_back(line, length);
    }

    int m_oldMask;
    mutable std::mutex m_lock;
    std::vector<std::string> m_lines;
};

#endif

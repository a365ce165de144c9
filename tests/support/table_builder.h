// Builds response-time data tables for tests the way the collection library
// delivers them: one contiguous block holding the table header, the entries
// (616 bytes apart) and then the texts the entries refer to, with every
// reference set as the layout wants it (a byte offset from the record that
// holds it on 64-bit builds, a plain pointer on 32-bit ones).
#ifndef WQ5_TESTS_TABLE_BUILDER_H
#define WQ5_TESTS_TABLE_BUILDER_H

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <stdexcept>
#include <string>
#include <vector>

#include "zub/zub1rt.h"

namespace wq5test {

// Copies `text` into an inline text field: NUL-padded when shorter, filling
// the whole field without a terminator when it is as long or longer.
template <size_t N>
void setField(char (&field)[N], const std::string& text)
{
    memset(field, 0, N);
    memcpy(field, text.data(), std::min(N, text.size()));
}

inline void setType(ZUB_RESPONSE_TIME_DATA& entry, const char* code)
{
    memcpy(entry.rdType, code, sizeof(entry.rdType));
}

class TableBuilder {
public:
    // A table of `count` zeroed entries (registeredFlag 1), with room for
    // `textSpace` bytes of texts behind them.
    explicit TableBuilder(int count, size_t textSpace = 4096)
        : m_count(count), m_block((HEADER + ZUB_ENTRY_SIZE * count + textSpace + 7) / 8, 0),
          m_textUsed(HEADER + ZUB_ENTRY_SIZE * static_cast<size_t>(count))
    {
        table()->entryCount = count;
        setEntriesRef(count > 0);
        for (int i = 0; i < count; ++i)
            entry(i).registeredFlag = 1;
    }

    ZUB_RESPONSE_TIME_DATA_TABLE* table() { return reinterpret_cast<ZUB_RESPONSE_TIME_DATA_TABLE*>(base()); }
    ZUB_RESPONSE_TIME_DATA& entry(int i)
    {
        return *reinterpret_cast<ZUB_RESPONSE_TIME_DATA*>(base() + HEADER + ZUB_ENTRY_SIZE * static_cast<size_t>(i));
    }

    // Points (or unpoints) the table's `entries` at the first entry.
    void setEntriesRef(bool present) { table()->entries = present ? refTo(table(), base() + HEADER) : 0; }

    // Stores `text` (and its NUL) behind the entries and sets `ref`, a
    // reference field of entry `i`, to it. Returns the stored copy, which
    // the code under test may change in place.
    char* setText(int i, ZUB_REF& ref, const std::string& text)
    {
        const size_t need = text.size() + 1;
        if (m_textUsed + need > m_block.size() * 8)
            throw std::length_error("TableBuilder: text space exhausted");
        char* copy = base() + m_textUsed;
        memcpy(copy, text.c_str(), need);
        m_textUsed += need;
        ref = refTo(&entry(i), copy);
        return copy;
    }

    int count() const { return m_count; }

private:
    static const size_t HEADER = sizeof(ZUB_RESPONSE_TIME_DATA_TABLE);

    char* base() { return reinterpret_cast<char*>(m_block.data()); }
    // A reference to `target` from the record at `from`.
    static ZUB_REF refTo(const void* from, char* target)
    {
#if ZUB_REF_IS_OFFSET
        return static_cast<ZUB_REF>(target - static_cast<const char*>(from));
#else
        (void)from;
        return target;
#endif
    }

    int m_count;
    std::vector<uint64_t> m_block;  // 8-byte aligned, never reallocated
    size_t m_textUsed;
};

}  // namespace wq5test

#endif

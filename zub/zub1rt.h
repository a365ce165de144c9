// Layout of the response-time data tables that the collection library
// delivers (one table per callback, 616 bytes per entry).
//
// The layout is that of the library's 32-bit interface: int, long and
// pointers are 4 bytes. On a 32-bit build a reference field (ZUB_REF) is a
// plain pointer. On a 64-bit build it holds a signed 32-bit byte offset from
// the start of the record that contains it (the table for `entries`, the
// entry for its texts); 0 means null. Read references only through
// zubDeref() and the accessors below, so that code reads the same on both.
#ifndef WQ5_ZUB_ZUB1RT_H
#define WQ5_ZUB_ZUB1RT_H

#include <stddef.h>
#include <stdint.h>

#if UINTPTR_MAX > 0xffffffffu
#define ZUB_REF_IS_OFFSET 1
typedef int32_t ZUB_REF;
#else
#define ZUB_REF_IS_OFFSET 0
typedef char* ZUB_REF;
#endif

#define ZUB_ENTRY_SIZE 616
#define ZUB_COMMON_SIZE 192

// HTTP view of the detail area (rdType "HTTP"), from entry offset 208.
typedef struct ZUB_HTTP_DETAIL {
    uint8_t gap208[4];
    ZUB_REF title;          // page title, may be null
    char httpText[32];      // NUL-terminated within its space, or full
    int32_t httpInt0;
    int32_t httpInt1;
    uint8_t gap256[24];
    int32_t httpInt2;
    int32_t httpInt3;
    int32_t httpInt4;
    int32_t httpInt5;
    int32_t httpInt6;
    int32_t httpInt7;
    int32_t httpEntryType;  // 1 = page, 2 = object
    int32_t httpInt8;
    int32_t httpInt9;
    int32_t httpInt10;
    int32_t httpInt11;
    int32_t httpInt12;
    uint8_t gap328[288];
} ZUB_HTTP_DETAIL;

// Streaming-media view of the detail area, from entry offset 208.
typedef struct ZUB_MEDIA_DETAIL {
    char mediaText[32];
    int32_t mediaInt0;
    uint8_t gap244[16];
    int32_t mediaInt1;
    int32_t mediaInt2;
    uint8_t gap268[348];
} ZUB_MEDIA_DETAIL;

// Detail of a measurement (from entry offset 192); the four text references
// are shared by both views.
typedef struct ResponseTimeDetail {
    ZUB_REF url;
    ZUB_REF detailText1;
    ZUB_REF detailText2;
    ZUB_REF detailText3;
    union {
        ZUB_HTTP_DETAIL http;
        ZUB_MEDIA_DETAIL media;
    } view;
} ResponseTimeDetail;

typedef struct ZUB_RESPONSE_TIME_DATA {
    uint8_t gap0[12];
    uint32_t registeredFlag;  // read in a table's first entry only
    char stampText[32];
    int32_t intValue;
    uint32_t ulongValue;
    char textA[40];
    uint16_t ushortA;
    uint16_t ushortB;
    char textB[16];
    char textC[24];
    int32_t intMetric1;
    int32_t intMetric2;
    int32_t intMetric3;
    int32_t intMetric4;
    int32_t intMetric5;
    int32_t longMetric1;  // `long` of the 32-bit interface
    int32_t longMetric2;
    int32_t longMetric3;
    uint8_t gap172[16];
    char rdType[4];       // type code, no terminator
    ResponseTimeDetail detail;
} ZUB_RESPONSE_TIME_DATA;

typedef struct ZUB_RESPONSE_TIME_DATA_TABLE {
    uint8_t gap0[16];
    int32_t entryCount;
    ZUB_REF entries;  // first entry; entries follow each other, 616 bytes apart
} ZUB_RESPONSE_TIME_DATA_TABLE;

#ifdef __cplusplus
#define ZUB_LAYOUT(type, field, offset) \
    static_assert(offsetof(type, field) == (offset), #type "." #field " offset")
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA_TABLE, entryCount, 16);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA_TABLE, entries, 20);
static_assert(sizeof(ZUB_RESPONSE_TIME_DATA_TABLE) == 24, "table header size");
static_assert(sizeof(ZUB_REF) == 4, "reference width");
static_assert(sizeof(ZUB_RESPONSE_TIME_DATA) == ZUB_ENTRY_SIZE, "entry size");
static_assert(sizeof(ResponseTimeDetail) == ZUB_ENTRY_SIZE - ZUB_COMMON_SIZE, "detail size");
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, registeredFlag, 12);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, stampText, 16);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, intValue, 48);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, ulongValue, 52);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, textA, 56);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, ushortA, 96);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, ushortB, 98);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, textB, 100);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, textC, 116);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, intMetric1, 140);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, intMetric5, 156);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, longMetric1, 160);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, longMetric3, 168);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, rdType, 188);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.url, 192);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.detailText1, 196);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.detailText2, 200);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.detailText3, 204);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.view.http.title, 212);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.view.http.httpText, 216);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.view.http.httpInt0, 248);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.view.http.httpInt1, 252);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.view.http.httpInt2, 280);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.view.http.httpInt3, 284);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.view.http.httpInt4, 288);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.view.http.httpInt5, 292);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.view.http.httpInt6, 296);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.view.http.httpInt7, 300);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.view.http.httpEntryType, 304);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.view.http.httpInt8, 308);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.view.http.httpInt12, 324);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.view.media.mediaText, 208);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.view.media.mediaInt0, 240);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.view.media.mediaInt1, 260);
ZUB_LAYOUT(ZUB_RESPONSE_TIME_DATA, detail.view.media.mediaInt2, 264);
#undef ZUB_LAYOUT
#endif

// The object a reference field of the record at `base` designates, or null.
static inline void* zubDeref(const void* base, ZUB_REF ref)
{
#if ZUB_REF_IS_OFFSET
    return ref == 0 ? NULL : (void*)((const char*)base + ref);
#else
    (void)base;
    return (void*)ref;
#endif
}

// Entry `i` of a table, or null when the table has no entry area.
static inline ZUB_RESPONSE_TIME_DATA* zubEntry(const ZUB_RESPONSE_TIME_DATA_TABLE* table, int32_t i)
{
    ZUB_RESPONSE_TIME_DATA* first = (ZUB_RESPONSE_TIME_DATA*)zubDeref(table, table->entries);
    return first == NULL ? NULL : first + i;
}

// A text reference of an entry (url, detailText1..3, title), or null.
static inline char* zubText(const ZUB_RESPONSE_TIME_DATA* entry, ZUB_REF ref)
{
    return (char*)zubDeref(entry, ref);
}

#endif

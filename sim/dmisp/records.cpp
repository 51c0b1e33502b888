#include "dmisp/records.h"

#include <cstring>
#include <ctime>
#include <strings.h>
#include <sys/time.h>

#include "base/bytes.h"
#include "dmisp/dmisp.h"

namespace dmisp {

namespace {

// Command parameters start at word 16; nothing a command names may lie
// before them or past the block.
constexpr uint32_t ParameterStart = 64;
constexpr uint32_t MaxKeys = 64;

uint32_t word(const uint8_t* block, uint32_t index)
{
    return loadWordAt(block, index);
}

// True when `length` bytes at `offset` lie in the parameter area.
bool inBlock(uint64_t offset, uint64_t length)
{
    return offset >= ParameterStart && offset + length <= CommandSize;
}

// A record being built: offsets count from its first byte; 0 is never
// handed out for an item, so that 0 can mean "absent".
class Buffer {
public:
    uint32_t alloc(size_t n)
    {
        uint32_t at = static_cast<uint32_t>(b_.size());
        b_.resize(b_.size() + n, 0);
        return at;
    }
    void put(uint32_t at, uint32_t value) { storeWord(&b_[at], value); }
    uint32_t string(const std::string& s)
    {
        uint32_t at = alloc(4 + s.size());
        put(at, static_cast<uint32_t>(s.size()));
        if (!s.empty())
            std::memcpy(&b_[at + 4], s.data(), s.size());
        return at;
    }
    uint32_t bytes(const void* data, size_t n)
    {
        uint32_t at = alloc(n);
        if (n != 0)
            std::memcpy(&b_[at], data, n);
        return at;
    }
    // The value of an attribute as the interface carries it, or 0 when it
    // has none: an unknown value, a write-only attribute, or an unsupported
    // string. An unsupported integer is 0x80000000.
    uint32_t value(const Attribute& a, const Value& v)
    {
        if (v.state == Value::Unknown || a.access == AccessWriteOnly)
            return 0;
        if (isIntegerType(a.type)) {
            int64_t n = v.state == Value::Unsupported ? INT32_MIN : v.number;
            if (a.type == TypeCounter64 || a.type == TypeInteger64)
                return bytes(&n, 8);
            uint32_t low = static_cast<uint32_t>(n);
            return bytes(&low, 4);
        }
        if (v.state == Value::Unsupported)
            return 0;
        if (a.type == TypeDate) {
            std::string t = v.text;
            t.resize(DateSize, '\0');
            return bytes(t.data(), DateSize);
        }
        return string(v.text);
    }
    std::vector<uint8_t>& data() { return b_; }
    size_t size() const { return b_.size(); }

private:
    std::vector<uint8_t> b_;
};

// ---- records ------------------------------------------------------------------

// Component record (7 words) at `at`, already allocated: id, match type,
// name, group count, group list (pairs of group id and class string), file
// count, file list.
void componentRecord(Buffer& b, uint32_t at, const Component& c)
{
    b.put(at, c.id);
    b.put(at + 4, 0);
    b.put(at + 8, b.string(c.name));
    b.put(at + 12, static_cast<uint32_t>(c.groups.size()));
    if (!c.groups.empty()) {
        uint32_t list = b.alloc(8 * c.groups.size());
        b.put(at + 16, list);
        for (size_t i = 0; i < c.groups.size(); ++i) {
            b.put(list + 8 * static_cast<uint32_t>(i), c.groups[i].id);
            b.put(list + 8 * static_cast<uint32_t>(i) + 4, b.string(c.groups[i].className));
        }
    }
}

// Group entry (5 words) at `at`: id, name, class, key count, key list; the
// keys carry attribute id and type, no value.
void groupEntry(Buffer& b, uint32_t at, const Group& g)
{
    b.put(at, g.id);
    b.put(at + 4, b.string(g.name));
    b.put(at + 8, b.string(g.className));
    b.put(at + 12, static_cast<uint32_t>(g.keys.size()));
    if (!g.keys.empty()) {
        uint32_t list = b.alloc(12 * g.keys.size());
        b.put(at + 16, list);
        for (size_t i = 0; i < g.keys.size(); ++i) {
            const Attribute& a = g.attributes[static_cast<size_t>(g.attributeIndex(g.keys[i]))];
            b.put(list + 12 * static_cast<uint32_t>(i), a.id);
            b.put(list + 12 * static_cast<uint32_t>(i) + 4, a.type);
        }
    }
}

// Attribute entry (7 words) at `at`: id, name, access, type, maximum size,
// enumeration count, enumeration list (pairs of value and text).
void attributeEntry(Buffer& b, uint32_t at, const Attribute& a)
{
    b.put(at, a.id);
    b.put(at + 4, b.string(a.name));
    b.put(at + 8, a.access);
    b.put(at + 12, a.type);
    b.put(at + 16, a.maxSize);
    b.put(at + 20, static_cast<uint32_t>(a.enumeration.size()));
    if (!a.enumeration.empty()) {
        uint32_t list = b.alloc(8 * a.enumeration.size());
        b.put(at + 24, list);
        for (size_t i = 0; i < a.enumeration.size(); ++i) {
            b.put(list + 8 * static_cast<uint32_t>(i), static_cast<uint32_t>(a.enumeration[i].first));
            b.put(list + 8 * static_cast<uint32_t>(i) + 4, b.string(a.enumeration[i].second));
        }
    }
}

// Attributes of a row that follow attribute `after` (0: all).
size_t firstAfter(const Group& g, uint32_t after)
{
    size_t i = 0;
    while (i < g.attributes.size() && g.attributes[i].id <= after)
        ++i;
    return i;
}

size_t rowRecordSize(const Group& g, uint32_t after)
{
    return 16 + 16 * (g.attributes.size() - firstAfter(g, after));
}

// Row record at `at` (rowRecordSize bytes, already allocated): group id, key
// count, key list, attribute count, then per attribute a word left 0, the
// attribute id, type and value offset. Keys and values go to the end.
void rowRecord(Buffer& b, uint32_t at, const Group& g, const Row& row, uint32_t after)
{
    size_t first = firstAfter(g, after);
    b.put(at, g.id);
    b.put(at + 4, static_cast<uint32_t>(g.keys.size()));
    b.put(at + 12, static_cast<uint32_t>(g.attributes.size() - first));
    if (!g.keys.empty()) {
        uint32_t list = b.alloc(12 * g.keys.size());
        b.put(at + 8, list);
        for (size_t k = 0; k < g.keys.size(); ++k) {
            size_t i = static_cast<size_t>(g.attributeIndex(g.keys[k]));
            const Attribute& a = g.attributes[i];
            uint32_t entry = list + 12 * static_cast<uint32_t>(k);
            b.put(entry, a.id);
            b.put(entry + 4, a.type);
            // Keys name the row even for a write-only key attribute.
            Attribute readable = a;
            readable.access = AccessReadOnly;
            b.put(entry + 8, b.value(readable, row[i]));
        }
    }
    for (size_t i = first; i < g.attributes.size(); ++i) {
        const Attribute& a = g.attributes[i];
        uint32_t entry = at + 16 + 16 * static_cast<uint32_t>(i - first);
        b.put(entry + 4, a.id);
        b.put(entry + 8, a.type);
        b.put(entry + 12, b.value(a, row[i]));
    }
}

// The 28-byte DMI date of now: yyyymmddHHMMSS.uuuuuu+ooo and three zero bytes.
void dateNow(uint8_t* out)
{
    struct timeval tv;
    gettimeofday(&tv, nullptr);
    struct tm tm;
    time_t seconds = tv.tv_sec;
    gmtime_r(&seconds, &tm);
    char text[96];
    std::snprintf(text, sizeof text, "%04d%02d%02d%02d%02d%02d.%06ld+000", tm.tm_year + 1900, tm.tm_mon + 1,
                  tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec, static_cast<long>(tv.tv_usec));
    std::memset(out, 0, DateSize);
    std::memcpy(out, text, 25);
}

// ---- command helpers ----------------------------------------------------------

// Class filter of a component listing: word 17 is the offset of a DMI
// string, 0 for none.
bool readFilter(const uint8_t* block, std::string* filter, bool* malformed)
{
    uint32_t at = word(block, 17);
    filter->clear();
    *malformed = false;
    if (at == 0)
        return false;
    if (!inBlock(at, 4) || !inBlock(at, 4ull + loadWord(block + at))) {
        *malformed = true;
        return false;
    }
    filter->assign(reinterpret_cast<const char*>(block + at + 4), loadWord(block + at));
    return true;
}

bool matchesFilter(const Component& c, const std::string& filter)
{
    for (const Group& g : c.groups)
        if (g.className.size() >= filter.size() && strncasecmp(g.className.c_str(), filter.c_str(), filter.size()) == 0)
            return true;
    return false;
}

Outcome fail(uint32_t status)
{
    Outcome o;
    o.status = status;
    return o;
}

Outcome componentListing(Database& db, const uint8_t* block, uint32_t code)
{
    std::string filter;
    bool malformed;
    bool filtered = readFilter(block, &filter, &malformed);
    if (malformed)
        return fail(StatusMalformed);
    uint32_t id = word(block, 16);
    const Component* found = nullptr;
    for (const auto& [cid, c] : db.components()) {
        if (filtered && !matchesFilter(c, filter))
            continue;
        if ((code == 512 && cid == id) || code == 513 || (code == 514 && cid > id)) {
            found = &c;
            break;
        }
    }
    if (found == nullptr)
        return fail(code == 512 ? StatusNotFound : StatusEndOfList);
    Buffer b;
    componentRecord(b, b.alloc(28), *found);
    Outcome o;
    o.count = 1;
    o.confirm = std::move(b.data());
    return o;
}

Outcome description(const std::string& text)
{
    Buffer b;
    b.string(text);
    Outcome o;
    o.count = 1;
    o.confirm = std::move(b.data());
    return o;
}

const Group* findGroup(const Component* c, uint32_t code, uint32_t id, uint32_t* status)
{
    for (const Group& g : c->groups)
        if (((code == 516 || code == 519) && g.id == id) || code == 517 || (code == 518 && g.id > id))
            return &g;
    *status = (code == 517 || code == 518) ? StatusEndOfList : StatusNotFound;
    return nullptr;
}

Outcome groupListing(Database& db, const uint8_t* block, uint32_t code)
{
    const Component* c = db.find(word(block, 16));
    if (c == nullptr)
        return fail(StatusNotFound);
    uint32_t status = 0;
    const Group* g = findGroup(c, code, word(block, 17), &status);
    if (g == nullptr)
        return fail(status);
    if (code == 519)
        return description(g->description);
    Buffer b;
    groupEntry(b, b.alloc(20), *g);
    Outcome o;
    o.count = 1;
    o.confirm = std::move(b.data());
    return o;
}

Outcome attributeListing(Database& db, const uint8_t* block, uint32_t code)
{
    const Component* c = db.find(word(block, 16));
    const Group* g = c != nullptr ? c->group(word(block, 17)) : nullptr;
    if (g == nullptr)
        return fail(StatusNotFound);
    uint32_t id = word(block, 18);
    const Attribute* a = nullptr;
    for (const Attribute& x : g->attributes)
        if (((code == 520 || code == 523) && x.id == id) || code == 521 || (code == 522 && x.id > id)) {
            a = &x;
            break;
        }
    if (a == nullptr)
        return fail((code == 521 || code == 522) ? StatusEndOfList : StatusNotFound);
    if (code == 523)
        return description(a->description);
    Buffer b;
    attributeEntry(b, b.alloc(28), *a);
    Outcome o;
    o.count = 1;
    o.confirm = std::move(b.data());
    return o;
}

// The row a get/set/reserve command addresses: by keys in a table, the one
// row of a group without keys. A Status.
uint32_t addressedRow(const Group& g, const uint8_t* block, size_t* row)
{
    if (g.keys.empty()) {
        if (g.rows.empty())
            return StatusNotFound;
        *row = 0;
        return StatusOk;
    }
    std::vector<Value> keys;
    uint32_t status = readKeys(g, block, &keys);
    if (status != StatusOk)
        return status;
    long at = g.findRow(keys);
    if (at < 0)
        return StatusNotFound;
    *row = static_cast<size_t>(at);
    return StatusOk;
}

// Reads the value a set command carries at word 21: integers always as 4
// bytes (also for the 64-bit types), strings as count and characters, dates
// as 28 bytes. A Status.
uint32_t readSetValue(const Attribute& a, const uint8_t* block, Value* v)
{
    uint32_t at = word(block, 21);
    if (isIntegerType(a.type)) {
        if (!inBlock(at, 4))
            return StatusMalformed;
        uint32_t raw = loadWord(block + at);
        if (a.type == TypeInteger || a.type == TypeInteger64)
            *v = Value::integer(static_cast<int32_t>(raw));
        else
            *v = Value::integer(raw);
    } else if (isStringType(a.type)) {
        if (!inBlock(at, 4) || !inBlock(at, 4ull + loadWord(block + at)))
            return StatusMalformed;
        uint32_t length = loadWord(block + at);
        if (length > a.maxSize)
            return StatusBadValue;
        *v = Value::string(std::string(reinterpret_cast<const char*>(block + at + 4), length));
    } else if (a.type == TypeDate) {
        if (!inBlock(at, DateSize))
            return StatusMalformed;
        *v = Value::string(std::string(reinterpret_cast<const char*>(block + at), DateSize));
    } else {
        return StatusBadValue;
    }
    return valueFits(a, *v) ? StatusOk : StatusBadValue;
}

Outcome attributeCommand(Database& db, const uint8_t* block, uint32_t code, uint32_t* persist)
{
    Component* c = db.find(word(block, 16));
    Group* g = c != nullptr ? c->group(word(block, 17)) : nullptr;
    if (g == nullptr)
        return fail(StatusNotFound);
    int ai = g->attributeIndex(word(block, 20));
    if (ai < 0)
        return fail(StatusNotFound);
    Attribute& a = g->attributes[static_cast<size_t>(ai)];
    size_t row = 0;
    uint32_t status = addressedRow(*g, block, &row);
    if (status != StatusOk)
        return fail(status);
    Value& current = g->rows[row][static_cast<size_t>(ai)];
    if (code == 768) {
        if (a.access == AccessWriteOnly)
            return fail(StatusWriteOnly);
        // Confirm: attribute id, group id, type, value offset, the value.
        Buffer b;
        uint32_t at = b.alloc(16);
        b.put(at, a.id);
        b.put(at + 4, g->id);
        b.put(at + 8, a.type);
        b.put(at + 12, b.value(a, current));
        Outcome o;
        o.count = 1;
        o.confirm = std::move(b.data());
        return o;
    }
    if (a.access == AccessReadOnly)
        return fail(StatusReadOnly);
    if (code != 769)
        return Outcome(); // reserve and release: the attribute can be set
    Value v;
    status = readSetValue(a, block, &v);
    if (status != StatusOk)
        return fail(status);
    Value old = current;
    current = v;
    if (!g->keys.empty() && !g->reindex()) {
        // Two rows would have the same keys.
        current = old;
        g->reindex();
        return fail(StatusBadValue);
    }
    if (g->keys.empty())
        a.value = v; // the group's own value, as its MIF text holds it
    *persist = c->id;
    return Outcome();
}

Outcome rowCommand(Database& db, const uint8_t* block, uint32_t code)
{
    const Component* c = db.find(word(block, 16));
    const Group* g = c != nullptr ? c->group(word(block, 17)) : nullptr;
    if (g == nullptr)
        return fail(StatusNotFound);
    size_t row = 0;
    if (code == 773) {
        if (g->rows.empty())
            return fail(StatusEndOfList);
    } else {
        uint32_t status = addressedRow(*g, block, &row);
        if (status != StatusOk)
            return fail(status);
        if (code == 774 && ++row >= g->rows.size())
            return fail(StatusEndOfList);
    }
    uint32_t after = word(block, 20);
    Buffer b;
    rowRecord(b, b.alloc(rowRecordSize(*g, after)), *g, g->rows[row], after);
    Outcome o;
    o.count = 1;
    o.confirm = std::move(b.data());
    return o;
}

} // namespace

uint32_t readKeys(const Group& g, const uint8_t* block, std::vector<Value>* keyValues)
{
    uint32_t n = word(block, 18), at = word(block, 19);
    if (n > MaxKeys || (n != 0 && !inBlock(at, 12ull * n)))
        return StatusMalformed;
    if (n != g.keys.size())
        return StatusBadKeys;
    keyValues->assign(g.keys.size(), Value());
    std::vector<bool> seen(g.keys.size(), false);
    for (uint32_t i = 0; i < n; ++i) {
        const uint8_t* entry = block + at + 12 * i;
        uint32_t id = loadWordAt(entry, 0), type = loadWordAt(entry, 1), value = loadWordAt(entry, 2);
        size_t k = 0;
        while (k < g.keys.size() && g.keys[k] != id)
            ++k;
        if (k == g.keys.size() || seen[k])
            return StatusBadKeys;
        seen[k] = true;
        const Attribute& a = g.attributes[static_cast<size_t>(g.attributeIndex(id))];
        if (type != a.type || value == 0)
            return StatusBadKeys;
        Value v;
        switch (type) {
        case TypeCounter:
        case TypeGauge:
        case TypeInteger:
            if (!inBlock(value, 4))
                return StatusMalformed;
            v = Value::integer(type == TypeInteger ? static_cast<int32_t>(loadWord(block + value))
                                                   : static_cast<int64_t>(loadWord(block + value)));
            break;
        case TypeCounter64:
        case TypeInteger64: {
            if (!inBlock(value, 8))
                return StatusMalformed;
            int64_t n64;
            std::memcpy(&n64, block + value, 8);
            v = Value::integer(n64);
            break;
        }
        case TypeOctetString:
        case TypeDisplayString:
            if (!inBlock(value, 4) || !inBlock(value, 4ull + loadWord(block + value)))
                return StatusMalformed;
            v = Value::string(std::string(reinterpret_cast<const char*>(block + value + 4), loadWord(block + value)));
            break;
        case TypeDate:
            if (!inBlock(value, DateSize))
                return StatusMalformed;
            v = Value::string(std::string(reinterpret_cast<const char*>(block + value), DateSize));
            break;
        default:
            return StatusBadKeys;
        }
        (*keyValues)[k] = v;
    }
    return StatusOk;
}

Outcome executeCommand(Database& db, const uint8_t* block, uint32_t* persistComponent)
{
    *persistComponent = 0;
    uint32_t code = word(block, 1);
    switch (code) {
    case 258:
    case 1024:
    case 1025:
        return Outcome();
    case 512:
    case 513:
    case 514:
        return componentListing(db, block, code);
    case 515: {
        const Component* c = db.find(word(block, 16));
        return c == nullptr ? fail(StatusNotFound) : description(c->description);
    }
    case 516:
    case 517:
    case 518:
    case 519:
        return groupListing(db, block, code);
    case 520:
    case 521:
    case 522:
    case 523:
        return attributeListing(db, block, code);
    case 768:
    case 769:
    case 770:
    case 771:
        return attributeCommand(db, block, code, persistComponent);
    case 772:
    case 773:
    case 774:
        return rowCommand(db, block, code);
    default:
        return fail(StatusMalformed);
    }
}

bool installPath(const uint8_t* block, std::string* path)
{
    uint32_t at = word(block, 19);
    if (!inBlock(at, 4) || !inBlock(at, 4ull + loadWord(block + at)))
        return false;
    path->assign(reinterpret_cast<const char*>(block + at + 4), loadWord(block + at));
    return path->find('\0') == std::string::npos && !path->empty();
}

namespace {

// Indication header (13 words): level check, type, length, component id,
// date (words 4 to 10), completion callback, data offset.
constexpr uint32_t HeaderSize = 52;

void header(Buffer& b, uint32_t levelCheck, uint32_t type, uint32_t component, uint32_t completion)
{
    b.put(0, levelCheck);
    b.put(4, type);
    b.put(12, component);
    uint8_t date[DateSize];
    dateNow(date);
    std::memcpy(&b.data()[16], date, DateSize);
    b.put(44, completion);
    b.put(48, HeaderSize);
}

} // namespace

std::vector<uint8_t> eventIndication(const Component& c, const std::vector<EventClassRow>& classes,
                                     uint32_t levelCheck, uint32_t completion)
{
    Buffer b;
    b.alloc(HeaderSize);
    header(b, levelCheck, 1, c.id, completion);
    // Event data: the class count, then per class component id, class
    // string, row count and rows.
    uint32_t data = b.alloc(4 + 16 * classes.size());
    b.put(data, static_cast<uint32_t>(classes.size()));
    std::vector<uint32_t> rowAt(classes.size());
    if (levelCheck == LevelCheck) {
        // Rows back to back, so that a reader steps from one row to the
        // next by its length; their keys and values follow all of them.
        for (size_t i = 0; i < classes.size(); ++i) {
            rowAt[i] = b.alloc(rowRecordSize(*classes[i].group, 0));
            b.put(data + 4 + 16 * static_cast<uint32_t>(i) + 12, rowAt[i]);
        }
    } else {
        // Each class's rows offset names an array of row offsets.
        for (size_t i = 0; i < classes.size(); ++i) {
            uint32_t array = b.alloc(4);
            rowAt[i] = b.alloc(rowRecordSize(*classes[i].group, 0));
            b.put(array, rowAt[i]);
            b.put(data + 4 + 16 * static_cast<uint32_t>(i) + 12, array);
        }
    }
    for (size_t i = 0; i < classes.size(); ++i) {
        uint32_t entry = data + 4 + 16 * static_cast<uint32_t>(i);
        const Group& g = *classes[i].group;
        b.put(entry, c.id);
        b.put(entry + 4, b.string(g.className));
        b.put(entry + 8, 1);
        rowRecord(b, rowAt[i], g, g.rows[classes[i].row], 0);
    }
    b.put(8, static_cast<uint32_t>(b.size()));
    return std::move(b.data());
}

std::vector<uint8_t> componentIndication(const Component& c, uint32_t type, uint32_t levelCheck, uint32_t completion)
{
    Buffer b;
    b.alloc(HeaderSize);
    header(b, levelCheck, type, c.id, completion);
    componentRecord(b, b.alloc(28), c);
    b.put(8, static_cast<uint32_t>(b.size()));
    return std::move(b.data());
}

} // namespace dmisp

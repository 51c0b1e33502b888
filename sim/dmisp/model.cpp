#include "dmisp/model.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <strings.h>

namespace dmisp {

int Group::attributeIndex(uint32_t attributeId) const
{
    // Attributes are kept in ascending id order.
    size_t lo = 0, hi = attributes.size();
    while (lo < hi) {
        size_t mid = (lo + hi) / 2;
        if (attributes[mid].id < attributeId)
            lo = mid + 1;
        else
            hi = mid;
    }
    if (lo < attributes.size() && attributes[lo].id == attributeId)
        return static_cast<int>(lo);
    return -1;
}

std::vector<size_t> Group::keyPositions() const
{
    std::vector<size_t> positions;
    for (uint32_t k : keys)
        positions.push_back(static_cast<size_t>(attributeIndex(k)));
    return positions;
}

bool Group::reindex()
{
    rowIndex.clear();
    if (keys.empty())
        return true;
    for (size_t i = 0; i < rows.size(); ++i)
        if (!rowIndex.emplace(keyIndexOf(*this, rows[i]), i).second)
            return false;
    return true;
}

long Group::findRow(const std::vector<Value>& keyValues) const
{
    auto it = rowIndex.find(keyIndexOfKeys(*this, keyValues));
    return it == rowIndex.end() ? -1 : static_cast<long>(it->second);
}

Group* Component::group(uint32_t groupId)
{
    for (Group& g : groups)
        if (g.id == groupId)
            return &g;
    return nullptr;
}

const Group* Component::group(uint32_t groupId) const
{
    return const_cast<Component*>(this)->group(groupId);
}

namespace {

// One key value as canonical bytes: its state, then the value by the
// attribute's type, so that equal DMI values give equal bytes.
void appendKey(std::string* out, const Attribute& a, const Value& v)
{
    // An unsupported integer travels as 0x80000000, so it is that key.
    bool integer = isIntegerType(a.type);
    Value::State state = (integer && v.state == Value::Unsupported) ? Value::Set : v.state;
    out->push_back(static_cast<char>(state));
    if (state != Value::Set)
        return;
    if (integer) {
        uint64_t n = static_cast<uint64_t>(v.state == Value::Unsupported ? INT32_MIN : v.number);
        if (a.type != TypeCounter64 && a.type != TypeInteger64)
            n &= 0xFFFFFFFFu;
        out->append(reinterpret_cast<const char*>(&n), sizeof n);
    } else {
        uint32_t length = static_cast<uint32_t>(v.text.size());
        out->append(reinterpret_cast<const char*>(&length), sizeof length);
        out->append(v.text);
    }
}

} // namespace

std::string keyIndexOf(const Group& g, const Row& row)
{
    std::string out;
    for (uint32_t k : g.keys) {
        int i = g.attributeIndex(k);
        appendKey(&out, g.attributes[static_cast<size_t>(i)], row[static_cast<size_t>(i)]);
    }
    return out;
}

std::string keyIndexOfKeys(const Group& g, const std::vector<Value>& keyValues)
{
    std::string out;
    for (size_t n = 0; n < g.keys.size() && n < keyValues.size(); ++n) {
        int i = g.attributeIndex(g.keys[n]);
        appendKey(&out, g.attributes[static_cast<size_t>(i)], keyValues[n]);
    }
    return out;
}

std::string valueText(const Attribute& a, const Value& v)
{
    if (v.state == Value::Unknown)
        return "unknown";
    if (v.state == Value::Unsupported)
        return "unsupported";
    if (isIntegerType(a.type))
        return std::to_string(v.number);
    if (a.type == TypeDate) {
        std::string t = v.text;
        while (!t.empty() && t.back() == '\0')
            t.pop_back();
        return t;
    }
    return v.text;
}

bool valueFits(const Attribute& a, const Value& v)
{
    if (v.state != Value::Set)
        return true;
    switch (a.type) {
    case TypeCounter:
    case TypeGauge:
        if (v.number < 0 || v.number > 0xFFFFFFFFll)
            return false;
        break;
    case TypeInteger:
        if (v.number < INT32_MIN || v.number > INT32_MAX)
            return false;
        break;
    case TypeCounter64:
    case TypeInteger64:
        break;
    case TypeOctetString:
    case TypeDisplayString:
        return v.text.size() <= a.maxSize;
    case TypeDate:
        return v.text.size() == DateSize;
    default:
        return false;
    }
    if (!a.enumeration.empty()) {
        for (const auto& e : a.enumeration)
            if (e.first == v.number)
                return true;
        return false;
    }
    return true;
}

bool valueFromText(const Attribute& a, const std::string& text, Value* v)
{
    if (isIntegerType(a.type)) {
        for (const auto& e : a.enumeration)
            if (e.second == text) {
                *v = Value::integer(e.first);
                return true;
            }
        for (const auto& e : a.enumeration)
            if (strcasecmp(e.second.c_str(), text.c_str()) == 0) {
                *v = Value::integer(e.first);
                return true;
            }
        if (text.empty())
            return false;
        errno = 0;
        char* end = nullptr;
        long long n = std::strtoll(text.c_str(), &end, 0);
        if (errno != 0 || *end != '\0')
            return false;
        // 32-bit types take their unsigned spelling too (0x80000000).
        if ((a.type == TypeInteger) && n > INT32_MAX && n <= 0xFFFFFFFFll)
            n = static_cast<int32_t>(static_cast<uint32_t>(n));
        *v = Value::integer(n);
        return valueFits(a, *v);
    }
    if (a.type == TypeDate) {
        if (text.size() > DateSize)
            return false;
        std::string t = text;
        t.resize(DateSize, '\0');
        *v = Value::string(t);
        return true;
    }
    *v = Value::string(text);
    return valueFits(a, *v);
}

} // namespace dmisp

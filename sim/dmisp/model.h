// The provider's database model: components, groups, attributes, rows.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <utility>
#include <vector>

namespace dmisp {

enum DmiType : uint32_t {
    TypeCounter = 1,
    TypeCounter64 = 2,
    TypeGauge = 3,
    TypeInteger = 5,
    TypeInteger64 = 6,
    TypeOctetString = 7,
    TypeDisplayString = 8,
    TypeDate = 11,
};

constexpr uint32_t DateSize = 28;

inline bool isIntegerType(uint32_t t)
{
    return t == TypeCounter || t == TypeCounter64 || t == TypeGauge || t == TypeInteger || t == TypeInteger64;
}
inline bool isStringType(uint32_t t)
{
    return t == TypeOctetString || t == TypeDisplayString;
}

// One attribute value. Integers of every width are held in `number` (the
// 32-bit types wrapped to their width), strings and dates in `text`.
struct Value {
    enum State : uint8_t { Set, Unknown, Unsupported };
    State state = Unknown;
    int64_t number = 0;
    std::string text;

    static Value integer(int64_t n)
    {
        Value v;
        v.state = Set;
        v.number = n;
        return v;
    }
    static Value string(std::string s)
    {
        Value v;
        v.state = Set;
        v.text = std::move(s);
        return v;
    }
    bool operator==(const Value&) const = default;
};

using Enumeration = std::vector<std::pair<int32_t, std::string>>;

struct Attribute {
    uint32_t id = 0;
    std::string name;
    std::string description;
    uint32_t type = TypeInteger;
    uint32_t maxSize = 4; // declared size for strings, value width otherwise
    uint32_t access = 1;  // dmisp::Access
    bool specific = false; // storage = specific
    Enumeration enumeration;
    Value value; // the template value
    bool operator==(const Attribute&) const = default;
};

using Row = std::vector<Value>; // one value per attribute, attribute id order

struct Group {
    uint32_t id = 0;
    std::string name;
    std::string className;
    std::string description;
    std::vector<uint32_t> keys;       // key attribute ids in key order
    std::vector<Attribute> attributes; // ascending id
    std::vector<Row> rows;            // a group without keys has exactly one
    // Key index of a table: keyIndexOf(row) -> position in rows. Rebuilt by
    // reindex() after rows or key values change; not part of the content.
    std::map<std::string, size_t> rowIndex;
    bool operator==(const Group& o) const
    {
        return id == o.id && name == o.name && className == o.className && description == o.description &&
               keys == o.keys && attributes == o.attributes && rows == o.rows;
    }

    // Index of attribute `id`, or -1.
    int attributeIndex(uint32_t attributeId) const;
    // Positions (attribute indices) of the key attributes, in key order.
    std::vector<size_t> keyPositions() const;
    // Rebuilds rowIndex; false when two rows have the same keys.
    bool reindex();
    // Position of the row with these key values (key order), or -1.
    long findRow(const std::vector<Value>& keyValues) const;
};

struct Component {
    uint32_t id = 0;
    std::string name;
    std::string description;
    std::string language;
    std::vector<Group> groups; // ascending id
    bool operator==(const Component&) const = default;

    Group* group(uint32_t groupId);
    const Group* group(uint32_t groupId) const;
};

// Canonical bytes of a row's key values, the index key of a table.
std::string keyIndexOf(const Group& g, const Row& row);
// The same built from key values given in key order.
std::string keyIndexOfKeys(const Group& g, const std::vector<Value>& keyValues);

// Text of a value for people and the control interface.
std::string valueText(const Attribute& a, const Value& v);
// Parses a text as a value of attribute `a` (decimal/hex integer or an
// enumeration text; string characters). False when it does not fit.
bool valueFromText(const Attribute& a, const std::string& text, Value* v);
// Checks a value against the attribute's type and size (and enumeration).
bool valueFits(const Attribute& a, const Value& v);

} // namespace dmisp

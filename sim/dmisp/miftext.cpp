#include "dmisp/miftext.h"

#include <algorithm>
#include <cctype>
#include <cstdio>
#include <map>
#include <optional>
#include <strings.h>

namespace dmisp {

namespace {

// ---- Lexer ----------------------------------------------------------------

struct Token {
    enum Kind { End, Word, Number, String, Punct } kind = End;
    std::string text; // word, string characters, or the punctuation character
    int64_t number = 0;
    int line = 0;
};

// A parse failure: the line and reason of the first error.
struct Failure {
    int line;
    std::string reason;
};

class Lexer {
public:
    explicit Lexer(const std::string& text) : s_(text) {}

    // Next token, or a failure.
    bool next(Token* t, Failure* f)
    {
        skipBlanks();
        t->line = line_;
        t->text.clear();
        t->number = 0;
        if (p_ >= s_.size()) {
            t->kind = Token::End;
            return true;
        }
        char c = s_[p_];
        if (c == '"')
            return string(t, f);
        if (std::isdigit(static_cast<unsigned char>(c)) ||
            (c == '-' && p_ + 1 < s_.size() && std::isdigit(static_cast<unsigned char>(s_[p_ + 1]))))
            return number(t, f);
        if (std::isalpha(static_cast<unsigned char>(c)) || c == '_') {
            size_t start = p_;
            while (p_ < s_.size() && (std::isalnum(static_cast<unsigned char>(s_[p_])) || s_[p_] == '_' ||
                                      s_[p_] == '-'))
                ++p_;
            t->kind = Token::Word;
            t->text = s_.substr(start, p_ - start);
            return true;
        }
        if (c == '=' || c == ',' || c == '{' || c == '}' || c == '(' || c == ')') {
            ++p_;
            t->kind = Token::Punct;
            t->text = std::string(1, c);
            return true;
        }
        *f = {line_, std::string("unexpected character '") + printable(c) + "'"};
        return false;
    }

private:
    static std::string printable(char c)
    {
        if (std::isprint(static_cast<unsigned char>(c)))
            return std::string(1, c);
        char buf[8];
        std::snprintf(buf, sizeof buf, "\\x%02x", static_cast<unsigned char>(c));
        return buf;
    }

    void skipBlanks()
    {
        while (p_ < s_.size()) {
            char c = s_[p_];
            if (c == '\n') {
                ++line_;
                ++p_;
            } else if (c == ' ' || c == '\t' || c == '\r' || c == '\f' || c == '\v') {
                ++p_;
            } else if (c == '/' && p_ + 1 < s_.size() && s_[p_ + 1] == '/') {
                while (p_ < s_.size() && s_[p_] != '\n')
                    ++p_;
            } else {
                break;
            }
        }
    }

    bool number(Token* t, Failure* f)
    {
        bool negative = false;
        if (s_[p_] == '-') {
            negative = true;
            ++p_;
        }
        int base = 10;
        if (s_[p_] == '0' && p_ + 1 < s_.size() && (s_[p_ + 1] == 'x' || s_[p_ + 1] == 'X')) {
            base = 16;
            p_ += 2;
        } else if (s_[p_] == '0') {
            base = 8;
        }
        size_t start = p_;
        uint64_t value = 0;
        bool overflow = false;
        while (p_ < s_.size() && std::isalnum(static_cast<unsigned char>(s_[p_]))) {
            char c = static_cast<char>(std::tolower(static_cast<unsigned char>(s_[p_])));
            int digit = std::isdigit(static_cast<unsigned char>(c)) ? c - '0' : (c >= 'a' && c <= 'f') ? c - 'a' + 10 : 99;
            if (digit >= base) {
                *f = {line_, "bad integer literal"};
                return false;
            }
            if (value > (UINT64_MAX - static_cast<uint64_t>(digit)) / static_cast<uint64_t>(base))
                overflow = true;
            value = value * static_cast<uint64_t>(base) + static_cast<uint64_t>(digit);
            ++p_;
        }
        if (p_ == start) {
            *f = {line_, "bad integer literal"};
            return false;
        }
        if (overflow || value > (negative ? uint64_t(INT64_MAX) + 1 : uint64_t(INT64_MAX))) {
            *f = {line_, "integer out of range"};
            return false;
        }
        t->kind = Token::Number;
        t->number = negative ? static_cast<int64_t>(0 - value) : static_cast<int64_t>(value);
        return true;
    }

    bool string(Token* t, Failure* f)
    {
        int startLine = line_;
        ++p_; // opening quote
        std::string out;
        for (;;) {
            if (p_ >= s_.size() || s_[p_] == '\n') {
                *f = {startLine, "unterminated string"};
                return false;
            }
            char c = s_[p_++];
            if (c == '"')
                break;
            if (c != '\\') {
                out.push_back(c);
                continue;
            }
            if (p_ >= s_.size()) {
                *f = {startLine, "unterminated string"};
                return false;
            }
            char e = s_[p_++];
            switch (e) {
            case 'n': out.push_back('\n'); break;
            case 't': out.push_back('\t'); break;
            case '\\': out.push_back('\\'); break;
            case '"': out.push_back('"'); break;
            case 'x': {
                int v = 0, digits = 0;
                while (digits < 2 && p_ < s_.size() && std::isxdigit(static_cast<unsigned char>(s_[p_]))) {
                    char h = static_cast<char>(std::tolower(static_cast<unsigned char>(s_[p_++])));
                    v = v * 16 + (std::isdigit(static_cast<unsigned char>(h)) ? h - '0' : h - 'a' + 10);
                    ++digits;
                }
                if (digits == 0) {
                    *f = {line_, "bad escape \\x without hex digits"};
                    return false;
                }
                out.push_back(static_cast<char>(v));
                break;
            }
            default:
                *f = {line_, std::string("bad escape \\") + printable(e)};
                return false;
            }
        }
        t->kind = Token::String;
        t->text = std::move(out);
        return true;
    }

    const std::string& s_;
    size_t p_ = 0;
    int line_ = 1;
};

bool wordIs(const Token& t, const char* w)
{
    return t.kind == Token::Word && strcasecmp(t.text.c_str(), w) == 0;
}

// ---- Parser -----------------------------------------------------------------

// A value as written: converted once the attribute's type is known.
struct RawValue {
    enum Kind { Omitted, Number, String, Word } kind = Omitted;
    int64_t number = 0;
    std::string text;
    int line = 0;
};

struct RawAttribute {
    Attribute a;
    std::optional<RawValue> value;
    std::string enumName; // a named enumeration to resolve
    int enumLine = 0;
    int line = 0;
    bool hasType = false;
};

struct RawGroup {
    Group g;
    bool hasId = false;
    int line = 0;
    int idLine = 0;
    size_t order = 0;
};

struct RawTable {
    std::string name;
    std::string className;
    uint32_t id = 0;
    bool hasId = false;
    int line = 0;
    int idLine = 0;
    size_t order = 0;
    std::vector<std::vector<RawValue>> rows;
    std::vector<int> rowLines;
};

struct NamedEnum {
    uint32_t type = TypeInteger;
    Enumeration values;
};

class Parser {
public:
    Parser(const std::string& text) : lex_(text) {}

    bool run(Component* out, Failure* f)
    {
        f_ = f;
        if (!advance())
            return false;
        Component c;
        if (wordIs(tok_, "language")) {
            if (!advance() || !expectPunct("=") || !stringValue(&c.language))
                return false;
        }
        int startLine = tok_.line;
        if (!expectWord("start") || !expectWord("component"))
            return false;
        if (!componentBody(&c, startLine))
            return false;
        if (tok_.kind != Token::End)
            return fail(tok_.line, "text after end component");
        *out = std::move(c);
        return true;
    }

private:
    bool fail(int line, std::string reason)
    {
        *f_ = {line, std::move(reason)};
        return false;
    }

    bool advance() { return lex_.next(&tok_, f_); }

    std::string describe(const Token& t)
    {
        switch (t.kind) {
        case Token::End: return "end of file";
        case Token::Word: return "'" + t.text + "'";
        case Token::Number: return "number " + std::to_string(t.number);
        case Token::String: return "string \"" + t.text + "\"";
        case Token::Punct: return "'" + t.text + "'";
        }
        return "?";
    }

    bool expectWord(const char* w)
    {
        if (!wordIs(tok_, w))
            return fail(tok_.line, std::string("expected '") + w + "', found " + describe(tok_));
        return advance();
    }

    bool expectPunct(const char* p)
    {
        if (tok_.kind != Token::Punct || tok_.text != p)
            return fail(tok_.line, std::string("expected '") + p + "', found " + describe(tok_));
        return advance();
    }

    // One or more adjacent string literals, concatenated.
    bool stringValue(std::string* out)
    {
        if (tok_.kind != Token::String)
            return fail(tok_.line, "expected a string, found " + describe(tok_));
        out->clear();
        while (tok_.kind == Token::String) {
            *out += tok_.text;
            if (!advance())
                return false;
        }
        return true;
    }

    bool integerValue(int64_t* out, int64_t min, int64_t max, const char* what)
    {
        if (tok_.kind != Token::Number)
            return fail(tok_.line, std::string("expected ") + what + ", found " + describe(tok_));
        if (tok_.number < min || tok_.number > max)
            return fail(tok_.line, std::string(what) + " out of range");
        *out = tok_.number;
        return advance();
    }

    bool idValue(uint32_t* out)
    {
        int64_t v;
        if (!integerValue(&v, 1, UINT32_MAX, "an id"))
            return false;
        *out = static_cast<uint32_t>(v);
        return true;
    }

    // "end <what>" reached? Consumes it.
    bool atEnd(const char* what, bool* done)
    {
        *done = false;
        if (!wordIs(tok_, "end"))
            return true;
        if (!advance())
            return false;
        if (!wordIs(tok_, what))
            return fail(tok_.line, std::string("expected 'end ") + what + "', found 'end' " + describe(tok_));
        *done = true;
        return advance();
    }

    bool componentBody(Component* c, int startLine)
    {
        bool haveName = false;
        for (;;) {
            bool done;
            if (!atEnd("component", &done))
                return false;
            if (done)
                break;
            if (tok_.kind == Token::End)
                return fail(tok_.line, "missing 'end component'");
            Token key = tok_;
            if (wordIs(key, "name")) {
                if (!advance() || !expectPunct("=") || !stringValue(&c->name))
                    return false;
                haveName = true;
            } else if (wordIs(key, "description")) {
                if (!advance() || !expectPunct("=") || !stringValue(&c->description))
                    return false;
            } else if (wordIs(key, "language")) {
                if (!advance() || !expectPunct("=") || !stringValue(&c->language))
                    return false;
            } else if (wordIs(key, "start")) {
                if (!advance())
                    return false;
                if (wordIs(tok_, "group")) {
                    if (!advance() || !group(key.line))
                        return false;
                } else if (wordIs(tok_, "table")) {
                    if (!advance() || !table(key.line))
                        return false;
                } else if (wordIs(tok_, "enum")) {
                    int line = tok_.line;
                    if (!advance())
                        return false;
                    NamedEnum e;
                    std::string name;
                    if (!enumBody(&e, &name))
                        return false;
                    if (name.empty())
                        return fail(line, "enumeration at component level without a name");
                    std::string lower = lowered(name);
                    if (enums_.count(lower))
                        return fail(line, "enumeration \"" + name + "\" declared twice");
                    enums_[lower] = e;
                } else {
                    return fail(tok_.line, "unknown block " + describe(tok_) + " in component");
                }
            } else {
                return fail(key.line, "unknown keyword " + describe(key) + " in component");
            }
        }
        if (!haveName)
            return fail(startLine, "component without a name");
        return finish(c);
    }

    static std::string lowered(std::string s)
    {
        for (char& ch : s)
            ch = static_cast<char>(std::tolower(static_cast<unsigned char>(ch)));
        return s;
    }

    // Items of "start enum" up to and including "end enum".
    bool enumBody(NamedEnum* e, std::string* name)
    {
        for (;;) {
            bool done;
            if (!atEnd("enum", &done))
                return false;
            if (done)
                return true;
            if (tok_.kind == Token::End)
                return fail(tok_.line, "missing 'end enum'");
            if (wordIs(tok_, "name")) {
                if (!advance() || !expectPunct("=") || !stringValue(name))
                    return false;
            } else if (wordIs(tok_, "type")) {
                int line = tok_.line;
                if (!advance() || !expectPunct("="))
                    return false;
                if (wordIs(tok_, "integer") || wordIs(tok_, "int"))
                    e->type = TypeInteger;
                else if (wordIs(tok_, "counter"))
                    e->type = TypeCounter;
                else if (wordIs(tok_, "gauge"))
                    e->type = TypeGauge;
                else
                    return fail(line, "enumeration type must be integer, counter or gauge");
                if (!advance())
                    return false;
            } else if (tok_.kind == Token::Number) {
                int line = tok_.line;
                int64_t v = tok_.number;
                if (v < INT32_MIN || v > 0xFFFFFFFFll)
                    return fail(line, "enumeration value out of range");
                if (!advance() || !expectPunct("="))
                    return false;
                std::string text;
                if (!stringValue(&text))
                    return false;
                int32_t value = static_cast<int32_t>(static_cast<uint32_t>(v));
                for (const auto& p : e->values)
                    if (p.first == value)
                        return fail(line, "enumeration value " + std::to_string(value) + " given twice");
                e->values.emplace_back(value, text);
            } else {
                return fail(tok_.line, "unknown keyword " + describe(tok_) + " in enumeration");
            }
        }
    }

    bool group(int startLine)
    {
        RawGroup rg;
        rg.line = startLine;
        rg.order = order_++;
        std::vector<RawAttribute> attrs;
        bool haveName = false, haveClass = false;
        int keyLine = 0;
        for (;;) {
            bool done;
            if (!atEnd("group", &done))
                return false;
            if (done)
                break;
            if (tok_.kind == Token::End)
                return fail(tok_.line, "missing 'end group'");
            Token key = tok_;
            if (wordIs(key, "name")) {
                if (!advance() || !expectPunct("=") || !stringValue(&rg.g.name))
                    return false;
                haveName = true;
            } else if (wordIs(key, "class")) {
                if (!advance() || !expectPunct("=") || !stringValue(&rg.g.className))
                    return false;
                haveClass = true;
            } else if (wordIs(key, "description")) {
                if (!advance() || !expectPunct("=") || !stringValue(&rg.g.description))
                    return false;
            } else if (wordIs(key, "id")) {
                rg.idLine = key.line;
                if (!advance() || !expectPunct("=") || !idValue(&rg.g.id))
                    return false;
                rg.hasId = true;
            } else if (wordIs(key, "key")) {
                keyLine = key.line;
                if (!advance() || !expectPunct("="))
                    return false;
                rg.g.keys.clear();
                for (;;) {
                    uint32_t k;
                    if (!idValue(&k))
                        return false;
                    if (std::find(rg.g.keys.begin(), rg.g.keys.end(), k) != rg.g.keys.end())
                        return fail(keyLine, "key attribute " + std::to_string(k) + " named twice");
                    rg.g.keys.push_back(k);
                    if (tok_.kind == Token::Punct && tok_.text == ",") {
                        if (!advance())
                            return false;
                        continue;
                    }
                    break;
                }
            } else if (wordIs(key, "start")) {
                if (!advance())
                    return false;
                if (!wordIs(tok_, "attribute"))
                    return fail(tok_.line, "unknown block " + describe(tok_) + " in group");
                RawAttribute ra;
                ra.line = key.line;
                if (!advance() || !attribute(&ra))
                    return false;
                for (const RawAttribute& o : attrs)
                    if (o.a.id == ra.a.id)
                        return fail(ra.line, "attribute id " + std::to_string(ra.a.id) + " used twice in group");
                attrs.push_back(std::move(ra));
            } else {
                return fail(key.line, "unknown keyword " + describe(key) + " in group");
            }
        }
        if (!haveName)
            return fail(rg.line, "group without a name");
        if (!haveClass)
            return fail(rg.line, "group without a class");
        std::sort(attrs.begin(), attrs.end(), [](const RawAttribute& x, const RawAttribute& y) { return x.a.id < y.a.id; });
        for (RawAttribute& ra : attrs) {
            if (!resolveAttribute(&ra))
                return false;
            rg.g.attributes.push_back(ra.a);
        }
        for (uint32_t k : rg.g.keys)
            if (rg.g.attributeIndex(k) < 0)
                return fail(keyLine, "key attribute " + std::to_string(k) + " is not an attribute of the group");
        groups_.push_back(std::move(rg));
        return true;
    }

    bool attribute(RawAttribute* ra)
    {
        bool haveName = false, haveId = false;
        for (;;) {
            bool done;
            if (!atEnd("attribute", &done))
                return false;
            if (done)
                break;
            if (tok_.kind == Token::End)
                return fail(tok_.line, "missing 'end attribute'");
            Token key = tok_;
            if (wordIs(key, "name")) {
                if (!advance() || !expectPunct("=") || !stringValue(&ra->a.name))
                    return false;
                haveName = true;
            } else if (wordIs(key, "description")) {
                if (!advance() || !expectPunct("=") || !stringValue(&ra->a.description))
                    return false;
            } else if (wordIs(key, "id")) {
                if (!advance() || !expectPunct("=") || !idValue(&ra->a.id))
                    return false;
                haveId = true;
            } else if (wordIs(key, "type")) {
                // A second type would leave the first one's enumeration
                // behind, and the written text would no longer parse.
                if (ra->hasType)
                    return fail(key.line, "attribute type given twice");
                if (!advance() || !expectPunct("=") || !type(ra))
                    return false;
                ra->hasType = true;
            } else if (wordIs(key, "access")) {
                if (!advance() || !expectPunct("="))
                    return false;
                if (wordIs(tok_, "read-only"))
                    ra->a.access = 1;
                else if (wordIs(tok_, "read-write"))
                    ra->a.access = 2;
                else if (wordIs(tok_, "write-only"))
                    ra->a.access = 3;
                else
                    return fail(tok_.line, "unknown access " + describe(tok_));
                if (!advance())
                    return false;
            } else if (wordIs(key, "storage")) {
                if (!advance() || !expectPunct("="))
                    return false;
                if (wordIs(tok_, "common"))
                    ra->a.specific = false;
                else if (wordIs(tok_, "specific"))
                    ra->a.specific = true;
                else
                    return fail(tok_.line, "unknown storage " + describe(tok_));
                if (!advance())
                    return false;
            } else if (wordIs(key, "value")) {
                if (!advance() || !expectPunct("="))
                    return false;
                RawValue v;
                if (!rawValue(&v, false))
                    return false;
                ra->value = v;
            } else {
                return fail(key.line, "unknown keyword " + describe(key) + " in attribute");
            }
        }
        if (!haveName)
            return fail(ra->line, "attribute without a name");
        if (!haveId)
            return fail(ra->line, "attribute without an id");
        if (!ra->hasType)
            return fail(ra->line, "attribute without a type");
        return true;
    }

    bool sizedType(RawAttribute* ra, uint32_t t)
    {
        int line = tok_.line;
        if (!advance())
            return false;
        if (tok_.kind != Token::Punct || tok_.text != "(")
            return fail(line, "string type without a size");
        if (!advance())
            return false;
        int64_t n;
        if (!integerValue(&n, 0, 65535, "a size") || !expectPunct(")"))
            return false;
        ra->a.type = t;
        ra->a.maxSize = static_cast<uint32_t>(n);
        return true;
    }

    bool type(RawAttribute* ra)
    {
        static const struct {
            const char* word;
            uint32_t type;
            uint32_t size;
        } plain[] = {
            {"counter", TypeCounter, 4},   {"counter64", TypeCounter64, 8}, {"gauge", TypeGauge, 4},
            {"integer", TypeInteger, 4},   {"int", TypeInteger, 4},         {"integer64", TypeInteger64, 8},
            {"int64", TypeInteger64, 8},   {"date", TypeDate, DateSize},
        };
        for (const auto& p : plain)
            if (wordIs(tok_, p.word)) {
                ra->a.type = p.type;
                ra->a.maxSize = p.size;
                return advance();
            }
        if (wordIs(tok_, "octetstring"))
            return sizedType(ra, TypeOctetString);
        if (wordIs(tok_, "displaystring") || wordIs(tok_, "string"))
            return sizedType(ra, TypeDisplayString);
        if (wordIs(tok_, "start")) {
            if (!advance() || !expectWord("enum"))
                return false;
            NamedEnum e;
            std::string ignored;
            if (!enumBody(&e, &ignored))
                return false;
            ra->a.type = e.type;
            ra->a.maxSize = 4;
            ra->a.enumeration = e.values;
            return true;
        }
        if (tok_.kind == Token::Word || tok_.kind == Token::String) {
            // A named enumeration, resolved at the end of the group.
            ra->enumName = tok_.text;
            ra->enumLine = tok_.line;
            return advance();
        }
        return fail(tok_.line, "unknown type " + describe(tok_));
    }

    // A literal value, or in a row also nothing (omitted).
    bool rawValue(RawValue* v, bool inRow)
    {
        v->line = tok_.line;
        if (tok_.kind == Token::Number) {
            v->kind = RawValue::Number;
            v->number = tok_.number;
            return advance();
        }
        if (tok_.kind == Token::String) {
            v->kind = RawValue::String;
            return stringValue(&v->text);
        }
        if (wordIs(tok_, "unsupported") || wordIs(tok_, "unknown")) {
            v->kind = RawValue::Word;
            v->text = lowered(tok_.text);
            return advance();
        }
        if (inRow && tok_.kind == Token::Punct && (tok_.text == "," || tok_.text == "}")) {
            v->kind = RawValue::Omitted;
            return true;
        }
        return fail(tok_.line, "expected a value, found " + describe(tok_));
    }

    bool resolveAttribute(RawAttribute* ra)
    {
        if (!ra->enumName.empty()) {
            auto it = enums_.find(lowered(ra->enumName));
            if (it == enums_.end())
                return fail(ra->enumLine, "unknown type or enumeration \"" + ra->enumName + "\"");
            ra->a.type = it->second.type;
            ra->a.maxSize = 4;
            ra->a.enumeration = it->second.values;
        }
        if (ra->value) {
            if (!convert(ra->a, *ra->value, Value(), &ra->a.value))
                return false;
        } else {
            ra->a.value = Value();
        }
        return true;
    }

    // Converts a written value for attribute `a`; an omitted one takes `fallback`.
    bool convert(const Attribute& a, const RawValue& rv, const Value& fallback, Value* out)
    {
        const std::string where = " for attribute " + std::to_string(a.id) + " \"" + a.name + "\"";
        switch (rv.kind) {
        case RawValue::Omitted:
            *out = fallback;
            return true;
        case RawValue::Word:
            out->state = rv.text == "unknown" ? Value::Unknown : Value::Unsupported;
            out->number = 0;
            out->text.clear();
            return true;
        case RawValue::Number: {
            if (!isIntegerType(a.type))
                return fail(rv.line, "integer value" + where + " of string type");
            int64_t n = rv.number;
            if (a.type == TypeInteger && n > INT32_MAX && n <= 0xFFFFFFFFll)
                n = static_cast<int32_t>(static_cast<uint32_t>(n));
            Value v = Value::integer(n);
            if (!valueFits(a, v))
                return fail(rv.line, (a.enumeration.empty() ? "integer out of range" : "value not in the enumeration") +
                                         where);
            *out = v;
            return true;
        }
        case RawValue::String: {
            if (isIntegerType(a.type)) {
                for (const auto& e : a.enumeration)
                    if (strcasecmp(e.second.c_str(), rv.text.c_str()) == 0) {
                        *out = Value::integer(e.first);
                        return true;
                    }
                if (a.enumeration.empty())
                    return fail(rv.line, "string value" + where + " of integer type");
                return fail(rv.line, "\"" + rv.text + "\" is not in the enumeration" + where);
            }
            Value v = Value::string(rv.text);
            if (a.type == TypeDate) {
                if (v.text.size() > DateSize)
                    return fail(rv.line, "date longer than 28 bytes" + where);
                v.text.resize(DateSize, '\0');
            } else if (v.text.size() > a.maxSize) {
                return fail(rv.line, "string longer than its size " + std::to_string(a.maxSize) + where);
            }
            *out = v;
            return true;
        }
        }
        return false;
    }

    bool table(int startLine)
    {
        RawTable t;
        t.line = startLine;
        t.order = order_++;
        bool haveClass = false;
        for (;;) {
            bool done;
            if (!atEnd("table", &done))
                return false;
            if (done)
                break;
            if (tok_.kind == Token::End)
                return fail(tok_.line, "missing 'end table'");
            Token key = tok_;
            if (wordIs(key, "name")) {
                if (!advance() || !expectPunct("=") || !stringValue(&t.name))
                    return false;
            } else if (wordIs(key, "class")) {
                if (!advance() || !expectPunct("=") || !stringValue(&t.className))
                    return false;
                haveClass = true;
            } else if (wordIs(key, "id")) {
                t.idLine = key.line;
                if (!advance() || !expectPunct("=") || !idValue(&t.id))
                    return false;
                t.hasId = true;
            } else if (key.kind == Token::Punct && key.text == "{") {
                if (!advance())
                    return false;
                std::vector<RawValue> row;
                if (!(tok_.kind == Token::Punct && tok_.text == "}")) {
                    for (;;) {
                        RawValue v;
                        if (!rawValue(&v, true))
                            return false;
                        row.push_back(v);
                        if (tok_.kind == Token::Punct && tok_.text == ",") {
                            if (!advance())
                                return false;
                            continue;
                        }
                        if (tok_.kind == Token::Punct && tok_.text == "}")
                            break;
                        return fail(tok_.line, "expected ',' or '}' in row, found " + describe(tok_));
                    }
                }
                if (!advance())
                    return false;
                t.rows.push_back(std::move(row));
                t.rowLines.push_back(key.line);
            } else {
                return fail(key.line, "unknown keyword " + describe(key) + " in table");
            }
        }
        if (!haveClass)
            return fail(t.line, "table without a class");
        tables_.push_back(std::move(t));
        return true;
    }

    // Builds the installed groups: groups with an id, and one group per table
    // from the template group of the table's class (the last one declared
    // before the table, else the first declared after it).
    bool finish(Component* c)
    {
        std::map<uint32_t, int> ids; // group id -> line that introduced it
        std::vector<Group> installed;
        std::vector<bool> replaced(groups_.size(), false);
        std::vector<Group> fromTables;
        std::vector<int> tableLines;
        for (const RawTable& t : tables_) {
            const RawGroup* tmpl = nullptr;
            size_t tmplIndex = 0;
            for (size_t i = 0; i < groups_.size(); ++i)
                if (groups_[i].g.className == t.className && groups_[i].order < t.order) {
                    tmpl = &groups_[i];
                    tmplIndex = i;
                }
            if (tmpl == nullptr)
                for (size_t i = 0; i < groups_.size(); ++i)
                    if (groups_[i].g.className == t.className) {
                        tmpl = &groups_[i];
                        tmplIndex = i;
                        break;
                    }
            if (tmpl == nullptr)
                return fail(t.line, "table of class \"" + t.className + "\" has no template group");
            Group g = tmpl->g;
            if (t.hasId) {
                g.id = t.id;
            } else if (tmpl->hasId) {
                g.id = tmpl->g.id; // the table gives the rows of the group itself
            } else {
                return fail(t.line, "table without an id");
            }
            if (tmpl->hasId && g.id == tmpl->g.id)
                replaced[tmplIndex] = true;
            if (!t.name.empty())
                g.name = t.name;
            g.rows.clear();
            g.rowIndex.clear();
            if (g.keys.empty() && t.rows.size() != 1)
                return fail(t.line, "table of a group without keys must have exactly one row");
            for (size_t r = 0; r < t.rows.size(); ++r) {
                const auto& raw = t.rows[r];
                if (raw.size() > g.attributes.size())
                    return fail(t.rowLines[r], "row has " + std::to_string(raw.size()) + " values, the group has " +
                                                    std::to_string(g.attributes.size()) + " attributes");
                Row row;
                for (size_t i = 0; i < g.attributes.size(); ++i) {
                    Value v;
                    RawValue omitted;
                    if (!convert(g.attributes[i], i < raw.size() ? raw[i] : omitted, g.attributes[i].value, &v))
                        return false;
                    row.push_back(v);
                }
                if (!g.keys.empty() && !g.rowIndex.emplace(keyIndexOf(g, row), g.rows.size()).second)
                    return fail(t.rowLines[r], "row has the same key values as an earlier row");
                g.rows.push_back(std::move(row));
            }
            fromTables.push_back(std::move(g));
            tableLines.push_back(t.hasId ? t.idLine : t.line);
        }
        for (size_t i = 0; i < groups_.size(); ++i) {
            const RawGroup& rg = groups_[i];
            if (!rg.hasId || replaced[i])
                continue;
            Group g = rg.g;
            Row row;
            bool keysSet = true;
            for (const Attribute& a : g.attributes)
                row.push_back(a.value);
            for (size_t k : g.keyPositions())
                if (row[k].state != Value::Set)
                    keysSet = false;
            // A keyed group outside a table is a table of one row, when its
            // keys have values.
            if (g.keys.empty() || keysSet)
                g.rows.push_back(std::move(row));
            g.reindex();
            if (!ids.emplace(g.id, rg.idLine).second)
                return fail(rg.idLine, "group id " + std::to_string(g.id) + " used twice");
            installed.push_back(std::move(g));
        }
        for (size_t i = 0; i < fromTables.size(); ++i) {
            if (!ids.emplace(fromTables[i].id, tableLines[i]).second)
                return fail(tableLines[i], "group id " + std::to_string(fromTables[i].id) + " used twice");
            installed.push_back(std::move(fromTables[i]));
        }
        std::sort(installed.begin(), installed.end(), [](const Group& x, const Group& y) { return x.id < y.id; });
        c->groups = std::move(installed);
        return true;
    }

    Lexer lex_;
    Token tok_;
    Failure* f_ = nullptr;
    size_t order_ = 0;
    std::vector<RawGroup> groups_;
    std::vector<RawTable> tables_;
    std::map<std::string, NamedEnum> enums_;
};

// ---- Writer -----------------------------------------------------------------

std::string quoted(const std::string& s)
{
    std::string out = "\"";
    for (unsigned char ch : s) {
        switch (ch) {
        case '\\': out += "\\\\"; break;
        case '"': out += "\\\""; break;
        case '\n': out += "\\n"; break;
        case '\t': out += "\\t"; break;
        default:
            if (ch < 0x20 || ch >= 0x7f) {
                char buf[8];
                std::snprintf(buf, sizeof buf, "\\x%02x", ch);
                out += buf;
            } else {
                out.push_back(static_cast<char>(ch));
            }
        }
    }
    return out + "\"";
}

// A value as MIF text: the states and integers as words, the rest quoted.
std::string literal(const Attribute& a, const Value& v)
{
    if (v.state != Value::Set || isIntegerType(a.type))
        return valueText(a, v);
    return quoted(valueText(a, v));
}

std::string typeText(const Attribute& a)
{
    if (!a.enumeration.empty()) {
        std::string s = "start enum\n";
        if (a.type == TypeCounter)
            s += "            type = counter\n";
        else if (a.type == TypeGauge)
            s += "            type = gauge\n";
        for (const auto& e : a.enumeration)
            s += "            " + std::to_string(e.first) + " = " + quoted(e.second) + "\n";
        return s + "        end enum";
    }
    switch (a.type) {
    case TypeCounter: return "counter";
    case TypeCounter64: return "counter64";
    case TypeGauge: return "gauge";
    case TypeInteger: return "integer";
    case TypeInteger64: return "integer64";
    case TypeOctetString: return "octetstring(" + std::to_string(a.maxSize) + ")";
    case TypeDisplayString: return "displaystring(" + std::to_string(a.maxSize) + ")";
    case TypeDate: return "date";
    }
    return "integer";
}

const char* accessText(uint32_t access)
{
    return access == 2 ? "read-write" : access == 3 ? "write-only" : "read-only";
}

void writeGroup(std::string* out, const Group& g, bool asTemplate)
{
    *out += "    start group\n";
    *out += "        name = " + quoted(g.name) + "\n";
    *out += "        class = " + quoted(g.className) + "\n";
    if (!asTemplate)
        *out += "        id = " + std::to_string(g.id) + "\n";
    if (!g.description.empty())
        *out += "        description = " + quoted(g.description) + "\n";
    if (!g.keys.empty()) {
        *out += "        key = ";
        for (size_t i = 0; i < g.keys.size(); ++i)
            *out += (i ? ", " : "") + std::to_string(g.keys[i]);
        *out += "\n";
    }
    for (size_t i = 0; i < g.attributes.size(); ++i) {
        const Attribute& a = g.attributes[i];
        *out += "        start attribute\n";
        *out += "            name = " + quoted(a.name) + "\n";
        *out += "            id = " + std::to_string(a.id) + "\n";
        if (!a.description.empty())
            *out += "            description = " + quoted(a.description) + "\n";
        *out += "            type = " + typeText(a) + "\n";
        *out += std::string("            access = ") + accessText(a.access) + "\n";
        *out += std::string("            storage = ") + (a.specific ? "specific" : "common") + "\n";
        // A group without keys holds its current value here; a table's
        // template keeps the default for omitted values.
        const Value& v = (!asTemplate && !g.rows.empty()) ? g.rows[0][i] : a.value;
        *out += "            value = " + literal(a, v) + "\n";
        *out += "        end attribute\n";
    }
    *out += "    end group\n";
}

} // namespace

bool parseMif(const std::string& text, const std::string& fileName, Component* out, std::string* error)
{
    Failure f{0, ""};
    Parser p(text);
    Component c;
    if (!p.run(&c, &f)) {
        if (error != nullptr)
            *error = fileName + ":" + std::to_string(f.line) + ": " + f.reason;
        return false;
    }
    *out = std::move(c);
    return true;
}

std::string writeMif(const Component& c)
{
    std::string out;
    if (!c.language.empty())
        out += "language = " + quoted(c.language) + "\n";
    out += "start component\n";
    out += "    name = " + quoted(c.name) + "\n";
    if (!c.description.empty())
        out += "    description = " + quoted(c.description) + "\n";
    for (const Group& g : c.groups) {
        if (g.keys.empty()) {
            writeGroup(&out, g, false);
            continue;
        }
        // A table: its template (no id) right before it, so that the table
        // finds this template even when another table shares the class.
        writeGroup(&out, g, true);
        out += "    start table\n";
        out += "        name = " + quoted(g.name) + "\n";
        out += "        class = " + quoted(g.className) + "\n";
        out += "        id = " + std::to_string(g.id) + "\n";
        for (const Row& row : g.rows) {
            out += "        {";
            for (size_t i = 0; i < row.size(); ++i)
                out += (i ? ", " : "") + literal(g.attributes[i], row[i]);
            out += "}\n";
        }
        out += "    end table\n";
    }
    out += "end component\n";
    return out;
}

} // namespace dmisp

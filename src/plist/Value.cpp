#include "plist/Value.h"

#include <charconv>

#include "plist/DateText.h"

namespace tavrix::plist {

const Value* Value::find(std::string_view key) const {
    const Dictionary* dictionary = asDictionary();
    if (dictionary == nullptr) {
        return nullptr;
    }
    auto it = dictionary->find(key);
    return it == dictionary->end() ? nullptr : &it->second;
}

Value* Value::find(std::string_view key) {
    return const_cast<Value*>(static_cast<const Value*>(this)->find(key));
}

namespace {

constexpr std::size_t kIndentWidth = 4;
constexpr std::size_t kDataBytesShown = 24;

bool needsQuotes(std::string_view text) {
    if (text.empty()) {
        return true;
    }
    for (unsigned char c : text) {
        bool plain = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                     c == '_' || c == '.' || c == '-' || c == '/' || c == ':' || c >= 0x80;
        if (!plain) {
            return true;
        }
    }
    return false;
}

void appendQuotedIfNeeded(std::string& out, std::string_view text) {
    if (!needsQuotes(text)) {
        out += text;
        return;
    }
    out += '"';
    for (char c : text) {
        switch (c) {
            case '"':
                out += "\\\"";
                break;
            case '\\':
                out += "\\\\";
                break;
            case '\n':
                out += "\\n";
                break;
            case '\t':
                out += "\\t";
                break;
            default:
                out += c;
        }
    }
    out += '"';
}

void appendReal(std::string& out, double value) {
    char buffer[64];
    auto result = std::to_chars(buffer, buffer + sizeof buffer, value);
    out.append(buffer, result.ptr);
}

void appendDate(std::string& out, const Date& date) {
    if (!hasDateText(date.secondsSinceReferenceDate)) {
        appendReal(out, date.secondsSinceReferenceDate);
        return;
    }
    out += readableDateText(date.secondsSinceReferenceDate) + " +0000";
}

void appendData(std::string& out, const Data& data) {
    static constexpr char kHex[] = "0123456789abcdef";
    out += "{length = " + std::to_string(data.size()) + ", bytes = 0x";
    std::size_t shown = data.size() <= kDataBytesShown ? data.size() : kDataBytesShown / 2;
    for (std::size_t i = 0; i < shown; ++i) {
        out += kHex[data[i] >> 4];
        out += kHex[data[i] & 0xf];
    }
    if (shown < data.size()) {
        out += " ... ";
        for (std::size_t i = data.size() - kDataBytesShown / 2; i < data.size(); ++i) {
            out += kHex[data[i] >> 4];
            out += kHex[data[i] & 0xf];
        }
    }
    out += '}';
}

void appendDescription(std::string& out, const Value& value, std::size_t depth, bool topLevel) {
    const std::string childIndent((depth + 1) * kIndentWidth, ' ');
    const std::string closingIndent(depth * kIndentWidth, ' ');
    switch (value.type()) {
        case Type::Dictionary: {
            const auto& dictionary = *value.asDictionary();
            out += "{\n";
            for (const auto& [key, child] : dictionary) {
                out += childIndent;
                appendQuotedIfNeeded(out, key);
                out += " = ";
                appendDescription(out, child, depth + 1, false);
                out += ";\n";
            }
            out += closingIndent + "}";
            break;
        }
        case Type::Array: {
            const auto& array = *value.asArray();
            out += "(\n";
            for (std::size_t i = 0; i < array.size(); ++i) {
                out += childIndent;
                appendDescription(out, array[i], depth + 1, false);
                out += i + 1 < array.size() ? ",\n" : "\n";
            }
            out += closingIndent + ")";
            break;
        }
        case Type::String:
            if (topLevel) {
                out += *value.asString();
            } else {
                appendQuotedIfNeeded(out, *value.asString());
            }
            break;
        case Type::Integer: {
            const Integer& integer = *value.asInteger();
            out += integer.isLargeUnsigned() ? std::to_string(integer.unsignedValue())
                                             : std::to_string(integer.signedValue());
            break;
        }
        case Type::Real:
            appendReal(out, *value.asReal());
            break;
        case Type::Boolean:
            out += *value.asBoolean() ? "true" : "false";
            break;
        case Type::Date:
            appendDate(out, *value.asDate());
            break;
        case Type::Data:
            appendData(out, *value.asData());
            break;
    }
}

}  // namespace

std::string Value::description() const {
    std::string out;
    appendDescription(out, *this, 0, true);
    return out;
}

std::string describe(const Value* value) {
    return value == nullptr ? "(null)" : value->description();
}

}  // namespace tavrix::plist

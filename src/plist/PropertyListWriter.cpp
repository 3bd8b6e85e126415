#include "plist/PropertyListWriter.h"

#include <bit>
#include <charconv>
#include <cmath>
#include <cstdint>
#include <cstring>
#include <ctime>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "plist/DateText.h"

namespace tavrix::plist {
namespace {

// Strings and keys end at a NUL character: neither format's readers can hold one.
std::string_view textOf(const std::string& text) {
    return std::string_view(text.data(), ::strnlen(text.data(), text.size()));
}

constexpr char kBase64[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

class XmlWriter {
  public:
    std::string finish(const Value& value) {
        out_.append("<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">\n");
        write(value, 0);
        out_.append("</plist>\n");
        return std::move(out_);
    }

  private:
    void indent(int depth) { out_.append(static_cast<std::size_t>(depth), '\t'); }

    void escaped(std::string_view text) {
        std::size_t start = 0;
        for (std::size_t i = 0; i < text.size(); ++i) {
            const char* entity = nullptr;
            switch (text[i]) {
                case '&':
                    entity = "&amp;";
                    break;
                case '<':
                    entity = "&lt;";
                    break;
                case '>':
                    entity = "&gt;";
                    break;
                default:
                    continue;
            }
            out_.append(text.substr(start, i - start));
            out_.append(entity);
            start = i + 1;
        }
        out_.append(text.substr(start));
    }

    void element(int depth, std::string_view tag, std::string_view text) {
        indent(depth);
        out_.append("<").append(tag).append(">");
        escaped(text);
        out_.append("</").append(tag).append(">\n");
    }

    void write(const Value& value, int depth) {
        switch (value.type()) {
            case Type::Dictionary: {
                const Dictionary& dictionary = *value.asDictionary();
                indent(depth);
                if (dictionary.empty()) {
                    out_.append("<dict/>\n");
                    return;
                }
                out_.append("<dict>\n");
                for (const auto& [key, child] : dictionary) {
                    element(depth + 1, "key", textOf(key));
                    write(child, depth + 1);
                }
                indent(depth);
                out_.append("</dict>\n");
                return;
            }
            case Type::Array: {
                const Array& array = *value.asArray();
                indent(depth);
                if (array.empty()) {
                    out_.append("<array/>\n");
                    return;
                }
                out_.append("<array>\n");
                for (const Value& child : array) {
                    write(child, depth + 1);
                }
                indent(depth);
                out_.append("</array>\n");
                return;
            }
            case Type::String:
                element(depth, "string", textOf(*value.asString()));
                return;
            case Type::Integer: {
                const Integer& integer = *value.asInteger();
                char digits[24];
                auto end =
                    integer.isLargeUnsigned()
                        ? std::to_chars(digits, digits + sizeof digits, integer.unsignedValue()).ptr
                        : std::to_chars(digits, digits + sizeof digits, integer.signedValue()).ptr;
                element(depth, "integer", std::string_view(digits, end - digits));
                return;
            }
            case Type::Real:
                element(depth, "real", realText(*value.asReal()));
                return;
            case Type::Boolean:
                indent(depth);
                out_.append(*value.asBoolean() ? "<true/>\n" : "<false/>\n");
                return;
            case Type::Date:
                element(depth, "date", xmlDateText(value.asDate()->secondsSinceReferenceDate));
                return;
            case Type::Data:
                data(*value.asData(), depth);
                return;
        }
    }

    std::string_view realText(double real) {
        if (std::isnan(real)) {
            return "nan";
        }
        if (std::isinf(real)) {
            return real > 0 ? "+infinity" : "-infinity";
        }
        // The shortest text that reads back as the same double.
        auto end = std::to_chars(number_, number_ + sizeof number_, real).ptr;
        return std::string_view(number_, end - number_);
    }

    void data(const Data& bytes, int depth) {
        indent(depth);
        if (bytes.empty()) {
            out_.append("<data></data>\n");
            return;
        }
        out_.append("<data>\n");
        constexpr std::size_t kLineBytes = 51;  // 68 characters of base64 a line
        for (std::size_t line = 0; line < bytes.size(); line += kLineBytes) {
            indent(depth);
            std::size_t end = std::min(bytes.size(), line + kLineBytes);
            for (std::size_t i = line; i < end; i += 3) {
                std::uint32_t group = std::uint32_t{bytes[i]} << 16;
                std::size_t present = std::min<std::size_t>(3, end - i);
                if (present > 1) {
                    group |= std::uint32_t{bytes[i + 1]} << 8;
                }
                if (present > 2) {
                    group |= bytes[i + 2];
                }
                char quad[4] = {kBase64[(group >> 18) & 63], kBase64[(group >> 12) & 63],
                                present > 1 ? kBase64[(group >> 6) & 63] : '=',
                                present > 2 ? kBase64[group & 63] : '='};
                out_.append(quad, 4);
            }
            out_.push_back('\n');
        }
        indent(depth);
        out_.append("</data>\n");
    }

    std::string out_;
    char number_[64] = {};
};

// The binary format: objects first, each container holding the indices of its children, then the
// table of object offsets and a trailer giving the sizes of both kinds of number.
class BinaryWriter {
  public:
    std::string finish(const Value& value) {
        collect(value);
        const std::uint64_t count = objects_.size();
        refSize_ = byteWidth(count);
        out_.append("bplist00");
        std::vector<std::uint64_t> offsets;
        offsets.reserve(count);
        for (const Object& object : objects_) {
            offsets.push_back(out_.size());
            encode(object);
        }
        const std::uint64_t table = out_.size();
        const unsigned offsetSize = byteWidth(table);
        for (std::uint64_t offset : offsets) {
            bigEndian(offset, offsetSize);
        }
        out_.append(6, '\0');
        out_.push_back(static_cast<char>(offsetSize));
        out_.push_back(static_cast<char>(refSize_));
        bigEndian(count, 8);
        bigEndian(0, 8);  // the top object comes first
        bigEndian(table, 8);
        return std::move(out_);
    }

  private:
    struct Object {
        const Value* value = nullptr;  // null for a key
        std::string_view text;         // a string's or key's text
        std::size_t children = 0;      // where a container's child indices start in refs_
    };

    static unsigned byteWidth(std::uint64_t largest) {
        if (largest <= 0xFF) {
            return 1;
        }
        if (largest <= 0xFFFF) {
            return 2;
        }
        return largest <= 0xFFFFFFFF ? 4 : 8;
    }

    std::uint64_t text(std::string_view text, const Value* value) {
        auto [known, added] = strings_.try_emplace(text, objects_.size());
        if (added) {
            objects_.push_back(Object{value, text, 0});
        }
        return known->second;
    }

    // Gives value and everything below it an index; a container's index comes before its
    // children's.
    std::uint64_t collect(const Value& value) {
        if (const std::string* string = value.asString()) {
            return text(textOf(*string), &value);
        }
        const std::uint64_t index = objects_.size();
        objects_.push_back(Object{&value, {}, refs_.size()});
        if (const Dictionary* dictionary = value.asDictionary()) {
            const std::size_t start = refs_.size();
            const std::size_t size = dictionary->size();
            refs_.resize(start + 2 * size);
            std::size_t i = 0;
            for (const auto& [key, child] : *dictionary) {
                refs_[start + i] = text(textOf(key), nullptr);
                refs_[start + size + i] = collect(child);
                ++i;
            }
        } else if (const Array* array = value.asArray()) {
            const std::size_t start = refs_.size();
            refs_.resize(start + array->size());
            for (std::size_t i = 0; i < array->size(); ++i) {
                refs_[start + i] = collect((*array)[i]);
            }
        }
        return index;
    }

    void bigEndian(std::uint64_t number, unsigned width) {
        for (unsigned i = width; i > 0; --i) {
            out_.push_back(static_cast<char>(number >> (8 * (i - 1))));
        }
    }

    void marker(unsigned kind, std::uint64_t count) {
        if (count < 15) {
            out_.push_back(static_cast<char>((kind << 4) | count));
            return;
        }
        out_.push_back(static_cast<char>((kind << 4) | 0x0F));
        unsigned width = byteWidth(count);
        out_.push_back(static_cast<char>(0x10 | std::countr_zero(width)));
        bigEndian(count, width);
    }

    void refs(std::size_t start, std::size_t count) {
        for (std::size_t i = 0; i < count; ++i) {
            bigEndian(refs_[start + i], refSize_);
        }
    }

    void string(std::string_view text) {
        bool ascii = true;
        for (char c : text) {
            if (static_cast<unsigned char>(c) >= 0x80) {
                ascii = false;
                break;
            }
        }
        if (ascii) {
            marker(0x5, text.size());
            out_.append(text);
            return;
        }
        std::u16string units = utf16(text);
        marker(0x6, units.size());
        for (char16_t unit : units) {
            bigEndian(unit, 2);
        }
    }

    // UTF-8 as UTF-16; a byte that starts no valid sequence becomes U+FFFD.
    static std::u16string utf16(std::string_view text) {
        std::u16string units;
        units.reserve(text.size());
        std::size_t i = 0;
        while (i < text.size()) {
            auto byte = static_cast<unsigned char>(text[i]);
            std::size_t extra = byte < 0x80             ? 0
                                : (byte & 0xE0) == 0xC0 ? 1
                                : (byte & 0xF0) == 0xE0 ? 2
                                : (byte & 0xF8) == 0xF0 ? 3
                                                        : 4;
            std::uint32_t code = extra == 0 ? byte : byte & (0x3F >> extra);
            bool valid = extra < 4 && extra < text.size() - i;
            for (std::size_t k = 1; valid && k <= extra; ++k) {
                auto next = static_cast<unsigned char>(text[i + k]);
                valid = (next & 0xC0) == 0x80;
                code = (code << 6) | (next & 0x3F);
            }
            static constexpr std::uint32_t kSmallest[] = {0, 0x80, 0x800, 0x10000, 0};
            if (!valid || code < kSmallest[extra] || code > 0x10FFFF ||
                (code >= 0xD800 && code <= 0xDFFF)) {
                units.push_back(u'\uFFFD');
                ++i;
                continue;
            }
            if (code >= 0x10000) {
                code -= 0x10000;
                units.push_back(static_cast<char16_t>(0xD800 + (code >> 10)));
                units.push_back(static_cast<char16_t>(0xDC00 + (code & 0x3FF)));
            } else {
                units.push_back(static_cast<char16_t>(code));
            }
            i += extra + 1;
        }
        return units;
    }

    void integer(const Integer& integer) {
        if (integer.isLargeUnsigned()) {
            // 16 bytes: the only width read as unsigned above INT64_MAX.
            out_.push_back(0x14);
            bigEndian(0, 8);
            bigEndian(integer.unsignedValue(), 8);
            return;
        }
        std::int64_t number = integer.signedValue();
        if (number < 0 || number > 0xFFFFFFFF) {
            // 1, 2 and 4 bytes are unsigned; 8 bytes are signed.
            out_.push_back(0x13);
            bigEndian(static_cast<std::uint64_t>(number), 8);
            return;
        }
        unsigned width = byteWidth(static_cast<std::uint64_t>(number));
        out_.push_back(static_cast<char>(0x10 | std::countr_zero(width)));
        bigEndian(static_cast<std::uint64_t>(number), width);
    }

    void encode(const Object& object) {
        if (object.value == nullptr || object.value->type() == Type::String) {
            string(object.text);
            return;
        }
        const Value& value = *object.value;
        switch (value.type()) {
            case Type::Dictionary: {
                std::size_t size = value.asDictionary()->size();
                marker(0xD, size);
                refs(object.children, 2 * size);
                return;
            }
            case Type::Array: {
                std::size_t size = value.asArray()->size();
                marker(0xA, size);
                refs(object.children, size);
                return;
            }
            case Type::Integer:
                integer(*value.asInteger());
                return;
            case Type::Real:
                out_.push_back(0x23);
                bigEndian(std::bit_cast<std::uint64_t>(*value.asReal()), 8);
                return;
            case Type::Boolean:
                out_.push_back(*value.asBoolean() ? 0x09 : 0x08);
                return;
            case Type::Date:
                out_.push_back(0x33);
                bigEndian(std::bit_cast<std::uint64_t>(
                              clampedDateSeconds(value.asDate()->secondsSinceReferenceDate)),
                          8);
                return;
            case Type::Data: {
                const Data& data = *value.asData();
                marker(0x4, data.size());
                out_.append(reinterpret_cast<const char*>(data.data()), data.size());
                return;
            }
            case Type::String:
                return;
        }
    }

    std::vector<Object> objects_;
    std::vector<std::uint64_t> refs_;
    std::unordered_map<std::string_view, std::uint64_t> strings_;
    std::string out_;
    unsigned refSize_ = 1;
};

}  // namespace

std::string writeXml(const Value& value) {
    return XmlWriter().finish(value);
}

std::string writeBinary(const Value& value) {
    return BinaryWriter().finish(value);
}

}  // namespace tavrix::plist

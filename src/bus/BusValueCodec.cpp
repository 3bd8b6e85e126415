#include "bus/BusValueCodec.h"

#include <cerrno>
#include <string_view>
#include <type_traits>

namespace tavrix::bus {
namespace {

using plist::Type;
using plist::Value;

// The content signature of the variant that carries a value of each type.
const char* variantSignature(const Value& value) {
    switch (value.type()) {
        case Type::Dictionary:
            return "a{sv}";
        case Type::Array:
            return "av";
        case Type::String:
            return "s";
        case Type::Integer:
            return value.asInteger()->isLargeUnsigned() ? "t" : "x";
        case Type::Real:
            return "d";
        case Type::Boolean:
            return "b";
        case Type::Date:
            return "(d)";
        case Type::Data:
            return "ay";
    }
    return nullptr;
}

// D-Bus strings end at the first NUL; a string holding one would arrive cut short.
int appendString(sd_bus_message* message, const std::string& text) {
    if (text.find('\0') != std::string::npos) {
        return -EINVAL;
    }
    return sd_bus_message_append_basic(message, 's', text.c_str());
}

int appendVariantContent(sd_bus_message* message, const Value& value, std::size_t depth);

int appendVariant(sd_bus_message* message, const Value& value, std::size_t depth) {
    if (depth > kMaxValueDepth) {
        return -ELOOP;
    }
    int r = sd_bus_message_open_container(message, 'v', variantSignature(value));
    if (r < 0) {
        return r;
    }
    r = appendVariantContent(message, value, depth);
    if (r < 0) {
        return r;
    }
    return sd_bus_message_close_container(message);
}

int appendVariantContent(sd_bus_message* message, const Value& value, std::size_t depth) {
    switch (value.type()) {
        case Type::Dictionary: {
            int r = sd_bus_message_open_container(message, 'a', "{sv}");
            if (r < 0) {
                return r;
            }
            for (const auto& [key, child] : *value.asDictionary()) {
                r = sd_bus_message_open_container(message, 'e', "sv");
                if (r >= 0) {
                    r = appendString(message, key);
                }
                if (r >= 0) {
                    r = appendVariant(message, child, depth + 1);
                }
                if (r >= 0) {
                    r = sd_bus_message_close_container(message);
                }
                if (r < 0) {
                    return r;
                }
            }
            return sd_bus_message_close_container(message);
        }
        case Type::Array: {
            int r = sd_bus_message_open_container(message, 'a', "v");
            if (r < 0) {
                return r;
            }
            for (const Value& child : *value.asArray()) {
                r = appendVariant(message, child, depth + 1);
                if (r < 0) {
                    return r;
                }
            }
            return sd_bus_message_close_container(message);
        }
        case Type::String:
            return appendString(message, *value.asString());
        case Type::Integer: {
            const plist::Integer& integer = *value.asInteger();
            if (integer.isLargeUnsigned()) {
                std::uint64_t bits = integer.unsignedValue();
                return sd_bus_message_append_basic(message, 't', &bits);
            }
            std::int64_t bits = integer.signedValue();
            return sd_bus_message_append_basic(message, 'x', &bits);
        }
        case Type::Real:
            return sd_bus_message_append_basic(message, 'd', value.asReal());
        case Type::Boolean: {
            int flag = *value.asBoolean() ? 1 : 0;
            return sd_bus_message_append_basic(message, 'b', &flag);
        }
        case Type::Date:
            return sd_bus_message_append(message, "(d)", value.asDate()->secondsSinceReferenceDate);
        case Type::Data: {
            const plist::Data& data = *value.asData();
            return sd_bus_message_append_array(message, 'y', data.data(), data.size());
        }
    }
    return -EINVAL;
}

int readVariant(sd_bus_message* message, std::optional<Value>& out, std::size_t depth);

int readByteArray(sd_bus_message* message, std::vector<std::uint8_t>& out) {
    const void* bytes = nullptr;
    std::size_t size = 0;
    int r = sd_bus_message_read_array(message, 'y', &bytes, &size);
    if (r < 0) {
        return r;
    }
    const auto* first = static_cast<const std::uint8_t*>(bytes);
    out.assign(first, first + size);
    return 1;
}

// Reads the elements of the array container just entered until its end.
template <typename ReadElement>
int readElements(sd_bus_message* message, ReadElement readElement) {
    for (;;) {
        int r = sd_bus_message_at_end(message, 0);
        if (r < 0) {
            return r;
        }
        if (r > 0) {
            return sd_bus_message_exit_container(message);
        }
        r = readElement();
        if (r < 0) {
            return r;
        }
    }
}

int readDictionary(sd_bus_message* message, std::optional<Value>& out, std::size_t depth) {
    int r = sd_bus_message_enter_container(message, 'a', "{sv}");
    if (r < 0) {
        return r;
    }
    plist::Dictionary dictionary;
    r = readElements(message, [&] {
        int step = sd_bus_message_enter_container(message, 'e', "sv");
        if (step < 0) {
            return step;
        }
        const char* key = nullptr;
        step = sd_bus_message_read_basic(message, 's', &key);
        if (step < 0) {
            return step;
        }
        std::optional<Value> child;
        step = readVariant(message, child, depth + 1);
        if (step < 0) {
            return step;
        }
        // A repeated key would lose one of the two values.
        if (!dictionary.emplace(key, std::move(*child)).second) {
            return -EINVAL;
        }
        return sd_bus_message_exit_container(message);
    });
    if (r < 0) {
        return r;
    }
    out = Value(std::move(dictionary));
    return 1;
}

int readArray(sd_bus_message* message, std::optional<Value>& out, std::size_t depth) {
    int r = sd_bus_message_enter_container(message, 'a', "v");
    if (r < 0) {
        return r;
    }
    plist::Array array;
    r = readElements(message, [&] {
        std::optional<Value> child;
        int step = readVariant(message, child, depth + 1);
        if (step >= 0) {
            array.push_back(std::move(*child));
        }
        return step;
    });
    if (r < 0) {
        return r;
    }
    out = Value(std::move(array));
    return 1;
}

template <typename T>
int readInteger(sd_bus_message* message, char type, std::optional<Value>& out) {
    T number{};
    int r = sd_bus_message_read_basic(message, type, &number);
    if (r < 0) {
        return r;
    }
    if constexpr (std::is_same_v<T, std::uint64_t>) {
        out = Value(plist::Integer::fromUnsigned(number));
    } else {
        out = Value(plist::Integer(static_cast<std::int64_t>(number)));
    }
    return 1;
}

// Reads the content of a variant whose signature is contents.
int readVariantContent(sd_bus_message* message, std::string_view contents,
                       std::optional<Value>& out, std::size_t depth) {
    if (contents == "a{sv}") {
        return readDictionary(message, out, depth);
    }
    if (contents == "av") {
        return readArray(message, out, depth);
    }
    if (contents == "ay") {
        plist::Data data;
        int r = readByteArray(message, data);
        if (r >= 0) {
            out = Value(std::move(data));
        }
        return r;
    }
    if (contents == "(d)") {
        double seconds = 0;
        int r = sd_bus_message_read(message, "(d)", &seconds);
        if (r >= 0) {
            out = Value(plist::Date{seconds});
        }
        return r;
    }
    if (contents.size() != 1) {
        return -EINVAL;
    }
    switch (contents[0]) {
        case 's': {
            const char* text = nullptr;
            int r = sd_bus_message_read_basic(message, 's', &text);
            if (r >= 0) {
                out = Value(std::string(text));
            }
            return r;
        }
        case 'd': {
            double real = 0;
            int r = sd_bus_message_read_basic(message, 'd', &real);
            if (r >= 0) {
                out = Value(real);
            }
            return r;
        }
        case 'b': {
            int flag = 0;
            int r = sd_bus_message_read_basic(message, 'b', &flag);
            if (r >= 0) {
                out = Value(flag != 0);
            }
            return r;
        }
        case 'x':
            return readInteger<std::int64_t>(message, 'x', out);
        case 't':
            return readInteger<std::uint64_t>(message, 't', out);
        case 'y':
            return readInteger<std::uint8_t>(message, 'y', out);
        case 'n':
            return readInteger<std::int16_t>(message, 'n', out);
        case 'q':
            return readInteger<std::uint16_t>(message, 'q', out);
        case 'i':
            return readInteger<std::int32_t>(message, 'i', out);
        case 'u':
            return readInteger<std::uint32_t>(message, 'u', out);
        default:
            return -EINVAL;
    }
}

int readVariant(sd_bus_message* message, std::optional<Value>& out, std::size_t depth) {
    if (depth > kMaxValueDepth) {
        return -ELOOP;
    }
    char type = 0;
    const char* contents = nullptr;
    int r = sd_bus_message_peek_type(message, &type, &contents);
    if (r < 0) {
        return r;
    }
    if (r == 0 || type != SD_BUS_TYPE_VARIANT) {
        return -ENXIO;
    }
    r = sd_bus_message_enter_container(message, 'v', contents);
    if (r < 0) {
        return r;
    }
    r = readVariantContent(message, contents, out, depth);
    if (r < 0) {
        return r;
    }
    return sd_bus_message_exit_container(message);
}

// Reads an array of zero or one element with readElement.
template <typename ReadElement>
int readZeroOrOne(sd_bus_message* message, const char* elementSignature, ReadElement readElement) {
    int r = sd_bus_message_enter_container(message, 'a', elementSignature);
    if (r < 0) {
        return r;
    }
    r = sd_bus_message_at_end(message, 0);
    if (r < 0) {
        return r;
    }
    if (r == 0) {
        r = readElement();
        if (r < 0) {
            return r;
        }
        r = sd_bus_message_at_end(message, 0);
        if (r < 0) {
            return r;
        }
        if (r == 0) {
            return -EINVAL;
        }
    }
    return sd_bus_message_exit_container(message);
}

}  // namespace

int appendValue(sd_bus_message* message, const Value& value) {
    return appendVariant(message, value, 1);
}

int readValue(sd_bus_message* message, std::optional<Value>& out) {
    std::optional<Value> value;
    int r = readVariant(message, value, 1);
    if (r < 0) {
        return r;
    }
    out = std::move(value);
    return 1;
}

int appendOptionalValue(sd_bus_message* message, const std::optional<Value>& value) {
    int r = sd_bus_message_open_container(message, 'a', "v");
    if (r < 0) {
        return r;
    }
    if (value) {
        r = appendValue(message, *value);
        if (r < 0) {
            return r;
        }
    }
    return sd_bus_message_close_container(message);
}

int readOptionalValue(sd_bus_message* message, std::optional<Value>& out) {
    std::optional<Value> value;
    int r = readZeroOrOne(message, "v", [&] { return readValue(message, value); });
    if (r < 0) {
        return r;
    }
    out = std::move(value);
    return 1;
}

int appendDictionary(sd_bus_message* message, const plist::Dictionary& dictionary) {
    // The dictionary counts as the first level, as it would inside a variant.
    return appendVariantContent(message, Value(dictionary), 1);
}

int readDictionary(sd_bus_message* message, plist::Dictionary& out) {
    std::optional<Value> value;
    int r = readDictionary(message, value, 1);
    if (r < 0) {
        return r;
    }
    out = std::move(*value->asDictionary());
    return 1;
}

int appendOptionalBytes(sd_bus_message* message,
                        const std::optional<std::vector<std::uint8_t>>& bytes) {
    int r = sd_bus_message_open_container(message, 'a', "ay");
    if (r < 0) {
        return r;
    }
    if (bytes) {
        r = sd_bus_message_append_array(message, 'y', bytes->data(), bytes->size());
        if (r < 0) {
            return r;
        }
    }
    return sd_bus_message_close_container(message);
}

int readOptionalBytes(sd_bus_message* message, std::optional<std::vector<std::uint8_t>>& out) {
    std::optional<std::vector<std::uint8_t>> bytes;
    int r = readZeroOrOne(message, "ay", [&] {
        bytes.emplace();
        return readByteArray(message, *bytes);
    });
    if (r < 0) {
        return r;
    }
    out = std::move(bytes);
    return 1;
}

}  // namespace tavrix::bus

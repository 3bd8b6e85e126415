#include "plist/PropertyListFormat.h"

#include <fcntl.h>
#include <plist/plist.h>
#include <sys/stat.h>
#include <unistd.h>

#include <bit>
#include <cctype>
#include <cerrno>
#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <memory>
#include <vector>

#include "io/AtomicFile.h"
#include "io/FileIO.h"
#include "io/UniqueFd.h"
#include "plist/DateText.h"
#include "plist/PropertyListWriter.h"

namespace tavrix::plist {
namespace {

struct NodeDeleter {
    void operator()(void* node) const { plist_free(node); }
};
using Node = std::unique_ptr<void, NodeDeleter>;

struct MallocDeleter {
    void operator()(char* buffer) const { std::free(buffer); }
};

// The tree walks below stop here too, whatever the bounds check let through.
constexpr int kMaxDepth = static_cast<int>(kMaxPropertyListDepth);
static_assert(kMaxPropertyListBytes <= std::numeric_limits<std::uint32_t>::max(),
              "libplist takes 32-bit lengths");
constexpr std::int64_t kMicrosPerSecond = 1000000;

// libplist 2.2 holds dates in 32-bit seconds and keeps whole seconds of XML dates only, so every
// date is read here instead, in the order libplist's tree holds them: XML ones from their texts,
// binary ones from their 64-bit values. Nothing when a date cannot be read that way (libplist's
// own reading is used then).
std::optional<std::vector<double>> xmlDates(std::string_view xml) {
    static constexpr std::string_view kOpen = "<date>";
    static constexpr std::string_view kClose = "</date>";
    std::vector<double> dates;
    for (std::size_t at = xml.find(kOpen); at != std::string_view::npos; at = xml.find(kOpen, at)) {
        at += kOpen.size();
        std::size_t end = xml.find(kClose, at);
        if (end == std::string_view::npos) {
            return std::nullopt;
        }
        std::optional<double> date = parseXmlDateText(xml.substr(at, end - at));
        if (!date) {
            return std::nullopt;
        }
        dates.push_back(*date);
        at = end + kClose.size();
    }
    return dates;
}

// A binary list's dates, depth first from its top object (array items and dictionary values in
// order), as libplist builds its tree. The bounds check has walked the same structure already;
// this walk still stops at anything out of place.
class BinaryDates {
  public:
    explicit BinaryDates(std::string_view bytes) : bytes_(bytes) {}

    std::optional<std::vector<double>> read() {
        if (bytes_.size() < 40) {
            return std::nullopt;
        }
        const std::size_t trailer = bytes_.size() - 32;
        offsetSize_ = static_cast<unsigned char>(bytes_[trailer + 6]);
        refSize_ = static_cast<unsigned char>(bytes_[trailer + 7]);
        objects_ = number(trailer + 8, 8);
        table_ = number(trailer + 24, 8);
        if (!visit(number(trailer + 16, 8), 0)) {
            return std::nullopt;
        }
        return std::move(dates_);
    }

  private:
    std::uint64_t number(std::size_t at, std::size_t size) const {
        std::uint64_t value = 0;
        for (std::size_t i = 0; i < size && at + i < bytes_.size(); ++i) {
            value = (value << 8) | static_cast<unsigned char>(bytes_[at + i]);
        }
        return value;
    }

    bool fits(std::uint64_t at, std::uint64_t size) const {
        return at <= bytes_.size() && size <= bytes_.size() - at;
    }

    bool visit(std::uint64_t object, int depth) {
        if (depth > kMaxDepth || object >= objects_ || offsetSize_ == 0 || refSize_ == 0 ||
            !fits(table_ + object * offsetSize_, offsetSize_)) {
            return false;
        }
        const std::uint64_t at = number(table_ + object * offsetSize_, offsetSize_);
        if (!fits(at, 1)) {
            return false;
        }
        const auto marker = static_cast<unsigned char>(bytes_[at]);
        const unsigned kind = marker >> 4;
        if (kind == 0x3) {
            if (!fits(at + 1, 8)) {
                return false;
            }
            dates_.push_back(std::bit_cast<double>(number(at + 1, 8)));
            return true;
        }
        if (kind < 0xA || kind > 0xD) {
            return true;
        }
        std::uint64_t count = marker & 0x0F;
        std::uint64_t contents = at + 1;
        if (count == 0x0F) {
            if (!fits(contents, 1)) {
                return false;
            }
            const std::size_t size = std::size_t{1} << (bytes_[contents] & 0x0F);
            if (size > 8 || !fits(contents + 1, size)) {
                return false;
            }
            count = number(contents + 1, size);
            contents += 1 + size;
        }
        // A dictionary's keys come first; only its values can be dates.
        const std::uint64_t first = kind == 0xD ? count : 0;
        if (count > objects_ || !fits(contents, (first + count) * refSize_)) {
            return false;
        }
        for (std::uint64_t i = 0; i < count; ++i) {
            if (!visit(number(contents + (first + i) * refSize_, refSize_), depth + 1)) {
                return false;
            }
        }
        return true;
    }

    std::string_view bytes_;
    unsigned offsetSize_ = 0;
    unsigned refSize_ = 0;
    std::uint64_t objects_ = 0;
    std::uint64_t table_ = 0;
    std::vector<double> dates_;
};

// Strings are UTF-8 text; bytes that are not cannot be written back as XML, so such a string makes
// the document damaged.
bool isValidUtf8(std::string_view text) {
    std::size_t i = 0;
    // Most text is ASCII: eight bytes at a time until the first byte that is not.
    while (text.size() - i >= 8) {
        std::uint64_t word;
        std::memcpy(&word, text.data() + i, 8);
        if ((word & 0x8080808080808080ULL) != 0) {
            break;
        }
        i += 8;
    }
    while (i < text.size()) {
        auto byte = static_cast<unsigned char>(text[i]);
        std::size_t extra = 0;
        std::uint32_t codePoint = 0;
        if (byte < 0x80) {
            ++i;
            continue;
        } else if ((byte & 0xE0) == 0xC0) {
            extra = 1;
            codePoint = byte & 0x1F;
        } else if ((byte & 0xF0) == 0xE0) {
            extra = 2;
            codePoint = byte & 0x0F;
        } else if ((byte & 0xF8) == 0xF0) {
            extra = 3;
            codePoint = byte & 0x07;
        } else {
            return false;
        }
        if (extra >= text.size() - i) {
            return false;  // cut off inside a sequence
        }
        for (std::size_t k = 1; k <= extra; ++k) {
            auto next = static_cast<unsigned char>(text[i + k]);
            if ((next & 0xC0) != 0x80) {
                return false;
            }
            codePoint = (codePoint << 6) | (next & 0x3F);
        }
        static constexpr std::uint32_t kSmallest[] = {0, 0x80, 0x800, 0x10000};
        if (codePoint < kSmallest[extra] || codePoint > 0x10FFFF ||
            (codePoint >= 0xD800 && codePoint <= 0xDFFF)) {
            return false;
        }
        i += extra + 1;
    }
    return true;
}

// Calls visit(key node, value node) for every entry of a dictionary node; false when an entry is
// malformed. Keys are checked before libplist reads them: it asserts on a key that is no key,
// which a damaged binary file can produce.
template <typename Visit>
bool forEachEntry(plist_t dictionary, Visit&& visit) {
    plist_dict_iter iter = nullptr;
    plist_dict_new_iter(dictionary, &iter);
    std::unique_ptr<void, decltype(&std::free)> iterOwner(iter, &std::free);
    for (;;) {
        plist_t child = nullptr;
        plist_dict_next_item(dictionary, iter, nullptr, &child);
        if (child == nullptr) {
            return true;
        }
        plist_t key = plist_dict_item_get_key(child);
        if (key == nullptr || plist_get_node_type(key) != PLIST_KEY || !visit(key, child)) {
            return false;
        }
    }
}

Date dateFromParts(std::int64_t seconds, std::int64_t micros) {
    // One division of an exact integer gives the double nearest to the decimal value.
    return Date{static_cast<double>(seconds * kMicrosPerSecond + micros) / kMicrosPerSecond};
}

std::size_t countDates(plist_t node, int depth) {
    if (depth > kMaxDepth) {
        return 0;
    }
    std::size_t count = 0;
    switch (plist_get_node_type(node)) {
        case PLIST_DATE:
            return 1;
        case PLIST_ARRAY:
            for (uint32_t i = 0, n = plist_array_get_size(node); i < n; ++i) {
                count += countDates(plist_array_get_item(node, i), depth + 1);
            }
            return count;
        case PLIST_DICT:
            forEachEntry(node, [&](plist_t, plist_t child) {
                count += countDates(child, depth + 1);
                return true;
            });
            return count;
        default:
            return 0;
    }
}

class NodeReader {
  public:
    explicit NodeReader(std::vector<double> exactDates) : exactDates_(std::move(exactDates)) {}

    std::optional<Value> read(plist_t node, int depth) {
        if (depth > kMaxDepth || node == nullptr) {
            return std::nullopt;
        }
        switch (plist_get_node_type(node)) {
            case PLIST_BOOLEAN: {
                uint8_t value = 0;
                plist_get_bool_val(node, &value);
                return Value(value != 0);
            }
            case PLIST_UINT:
            case PLIST_UID: {
                uint64_t value = 0;
                if (plist_get_node_type(node) == PLIST_UID) {
                    plist_get_uid_val(node, &value);
                    return Value(Integer::fromUnsigned(value));
                }
                plist_get_uint_val(node, &value);
                return Value(isLargeUnsigned(node, value) ? Integer::fromUnsigned(value)
                                                          : Integer(static_cast<int64_t>(value)));
            }
            case PLIST_REAL: {
                double value = 0;
                plist_get_real_val(node, &value);
                return Value(value);
            }
            case PLIST_STRING:
            case PLIST_KEY: {
                uint64_t length = 0;
                const char* text = plist_get_string_ptr(node, &length);
                std::string_view view(text == nullptr ? "" : text, text == nullptr ? 0 : length);
                if (!isValidUtf8(view)) {
                    return std::nullopt;
                }
                return Value(view);
            }
            case PLIST_DATA: {
                uint64_t length = 0;
                const char* bytes = plist_get_data_ptr(node, &length);
                const auto* begin = reinterpret_cast<const std::uint8_t*>(bytes);
                return Value(bytes == nullptr ? Data{} : Data(begin, begin + length));
            }
            case PLIST_DATE: {
                int32_t seconds = 0;
                int32_t micros = 0;
                plist_get_date_val(node, &seconds, &micros);
                // libplist answers the truncated seconds and the fraction's magnitude.
                if (seconds < 0) {
                    micros = -micros;
                }
                if (nextDate_ < exactDates_.size()) {
                    return Value(Date{exactDates_[nextDate_++]});
                }
                return Value(dateFromParts(seconds, micros));
            }
            case PLIST_ARRAY: {
                Array array;
                uint32_t size = plist_array_get_size(node);
                array.reserve(size);
                for (uint32_t i = 0; i < size; ++i) {
                    auto item = read(plist_array_get_item(node, i), depth + 1);
                    if (!item) {
                        return std::nullopt;
                    }
                    array.push_back(std::move(*item));
                }
                return Value(std::move(array));
            }
            case PLIST_DICT:
                return readDictionary(node, depth);
            default:
                return std::nullopt;
        }
    }

  private:
    // libplist marks integers read as unsigned above INT64_MAX with a 16-byte length, which is not
    // public; its node comparison does look at the length, so a signed twin tells them apart.
    static bool isLargeUnsigned(plist_t node, uint64_t value) {
        if (value <= static_cast<uint64_t>(std::numeric_limits<int64_t>::max())) {
            return false;
        }
        Node signedTwin(plist_new_uint(value));
        return plist_compare_node_value(node, signedTwin.get()) == 0;
    }

    std::optional<Value> readDictionary(plist_t node, int depth) {
        Dictionary dictionary;
        bool complete = forEachEntry(node, [&](plist_t keyNode, plist_t child) {
            auto value = read(child, depth + 1);
            char* rawKey = nullptr;
            plist_get_key_val(keyNode, &rawKey);
            std::unique_ptr<char, MallocDeleter> key(rawKey);
            if (!value || key == nullptr || !isValidUtf8(key.get())) {
                return false;
            }
            // Files this process writes hold their keys sorted, so the end is usually the spot.
            dictionary.insert_or_assign(dictionary.end(), std::string(key.get()),
                                        std::move(*value));
            return true;
        });
        if (!complete) {
            return std::nullopt;
        }
        return Value(std::move(dictionary));
    }

    std::vector<double> exactDates_;
    std::size_t nextDate_ = 0;
};

std::string tooLarge() {
    return "it is larger than " + std::to_string(kMaxPropertyListBytes) + " bytes";
}

bool endsWithClosingTag(std::string_view xml) {
    while (!xml.empty() &&
           (xml.back() == '\0' || std::isspace(static_cast<unsigned char>(xml.back())))) {
        xml.remove_suffix(1);
    }
    return xml.ends_with("</plist>");
}

// Fails, with why, for bytes refused before libplist sees them. The one table of what the reader
// takes: the writer checks its own output against it.
Result<> checkReadable(std::string_view bytes, bool binary) {
    if (bytes.empty()) {
        return Failure{"it is empty"};
    }
    if (bytes.size() > kMaxPropertyListBytes) {
        return Failure{tooLarge()};
    }
    // libplist accepts a document cut off before its closing tag; a truncated file is no value.
    if (!binary && !endsWithClosingTag(bytes)) {
        return Failure{"it is not a complete XML property list"};
    }
    return binary ? checkBinaryBounds(bytes) : checkXmlBounds(bytes);
}

bool isBinary(std::string_view bytes) {
    return bytes.size() <= kMaxPropertyListBytes &&
           plist_is_binary(bytes.data(), static_cast<uint32_t>(bytes.size())) != 0;
}

}  // namespace

Result<Value> parse(std::string_view bytes) {
    const bool binary = isBinary(bytes);
    if (Result<> readable = checkReadable(bytes, binary); !readable) {
        return readable.failure();
    }
    plist_t raw = nullptr;
    plist_from_memory(bytes.data(), static_cast<uint32_t>(bytes.size()), &raw);
    Node root(raw);
    if (!root) {
        return Failure{"it is not a property list"};
    }
    std::optional<std::vector<double>> dates = binary ? BinaryDates(bytes).read() : xmlDates(bytes);
    if (!dates || dates->size() != countDates(root.get(), 0)) {
        dates.emplace();
    }
    auto value = NodeReader(std::move(*dates)).read(root.get(), 0);
    if (!value) {
        return Failure{"it holds text that is not UTF-8 or a damaged dictionary"};
    }
    return std::move(*value);
}

namespace {

Failure systemFailure(int error) {
    return {std::strerror(error), error};
}

}  // namespace

Result<std::string> readFileBytes(const std::string& path) {
    // Without O_NONBLOCK, opening a FIFO would wait for a writer for ever.
    io::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
    if (!fd) {
        return systemFailure(errno);
    }
    return readOpenFileBytes(fd.get());
}

Result<std::string> readOpenFileBytes(int fd) {
    struct stat info {};
    if (::fstat(fd, &info) != 0) {
        return systemFailure(errno);
    }
    if (!S_ISREG(info.st_mode)) {
        return Failure{"it is not a regular file"};
    }
    if (info.st_size < 0 || static_cast<std::uint64_t>(info.st_size) > kMaxPropertyListBytes) {
        return Failure{tooLarge()};
    }
    // A file that grew since fstat is still held to the cap.
    std::string bytes;
    if (int error = io::readAll(fd, bytes, kMaxPropertyListBytes); error != 0) {
        return error == EFBIG ? Failure{tooLarge()} : systemFailure(error);
    }
    return bytes;
}

Result<Value> readFile(const std::string& path) {
    Result<std::string> bytes = readFileBytes(path);
    if (!bytes) {
        return bytes.failure();
    }
    return parse(*bytes);
}

Result<Value> readOpenFile(int fd) {
    Result<std::string> bytes = readOpenFileBytes(fd);
    if (!bytes) {
        return bytes.failure();
    }
    return parse(*bytes);
}

Result<std::string> serialize(const Value& value, Format format) {
    std::string bytes = format == Format::Binary ? writeBinary(value) : writeXml(value);
    if (bytes.empty()) {
        return Failure{"the value cannot be encoded"};
    }
    // Never bytes the reader would refuse: a file written so would read back as no value.
    if (Result<> readable = checkReadable(bytes, format == Format::Binary); !readable) {
        return Failure{"a reader would refuse it: " + readable.reason()};
    }
    return bytes;
}

bool writeFile(const std::string& path, const Value& value, Format format) {
    Result<std::string> bytes = serialize(value, format);
    return bytes && io::replaceFileAtomically(path, *bytes, 0644) == 0;
}

}  // namespace tavrix::plist

#include "plist/PropertyListBounds.h"

#include <cstdint>
#include <vector>

namespace tavrix::plist {
namespace {

Failure tooDeep() {
    return {"it nests deeper than " + std::to_string(kMaxPropertyListDepth) + " levels"};
}

Failure tooManyNodes() {
    return {"it holds more than " + std::to_string(kMaxPropertyListNodes) + " values"};
}

// Scans XML markup the way libplist's reader does, counting elements and their nesting. Where
// two readings of a construct are possible (quotes honoured or not), the text between the two
// possible ends counts every element start as an open element and no element end, so the count
// can only be too high, never too low. Depth never goes below zero, so stray end tags cannot
// pay for later open ones.
class XmlScan {
  public:
    explicit XmlScan(std::string_view xml) : xml_(xml) {}

    Result<> run() {
        std::size_t at = 0;
        while ((at = xml_.find('<', at)) != std::string_view::npos) {
            std::string_view rest = xml_.substr(at);
            if (rest.starts_with("<!--")) {
                at = skip(at, at + 4, "-->", false);
            } else if (rest.starts_with("<![CDATA[")) {
                at = skip(at, at + 9, "]]>", false);
            } else if (rest.starts_with("<?")) {
                at = skip(at, at + 2, "?>", true);
            } else if (rest.starts_with("<!")) {
                at = skipDeclaration(at);
            } else if (rest.starts_with("</")) {
                depth_ = depth_ > 0 ? depth_ - 1 : 0;
                at = skip(at, at + 2, ">", true);
            } else {
                at = tag(at);
            }
            if (depth_ > kMaxPropertyListDepth + 1) {  // the <plist> element adds one
                return tooDeep();
            }
            if (elements_ > kMaxPropertyListNodes + 1) {
                return tooManyNodes();
            }
        }
        return {};
    }

  private:
    static constexpr std::size_t npos = std::string_view::npos;

    // The first terminator at or after from, skipping double-quoted text when quoted. This scan
    // runs over every byte of every document read: the whole terminator is compared only where
    // its first character is.
    std::size_t find(std::size_t from, std::string_view terminator, bool quoted) const {
        const char first = terminator[0];
        const char* data = xml_.data();
        for (std::size_t at = from; at < xml_.size(); ++at) {
            if (quoted && data[at] == '"') {
                at = xml_.find('"', at + 1);
                if (at == npos) {
                    return npos;
                }
            } else if (data[at] == first &&
                       (terminator.size() == 1 ||
                        xml_.compare(at, terminator.size(), terminator) == 0)) {
                return at;
            }
        }
        return npos;
    }

    // Skips a construct that starts at start and whose body starts at body; answers where
    // scanning goes on. quoted says whether libplist skips double-quoted text while it looks for
    // the terminator (it does in tags, declarations and processing instructions, not in comments
    // or CDATA); text that only the unquoted reading would take as markup is hedged.
    std::size_t skip(std::size_t start, std::size_t body, std::string_view terminator,
                     bool quoted) {
        std::size_t end = find(body, terminator, quoted);
        if (end == npos) {
            uncertain(start + 1, xml_.size());
            return xml_.size();
        }
        if (quoted) {
            uncertain(find(body, terminator, false), end);
        }
        return end + terminator.size();
    }

    // <!DOCTYPE ...> and its kin; an internal subset in brackets ends at "]>".
    std::size_t skipDeclaration(std::size_t start) {
        std::size_t close = find(start + 2, ">", true);
        std::size_t bracket = find(start + 2, "[", true);
        if (bracket != npos && (close == npos || bracket < close)) {
            return skip(start, bracket + 1, "]>", true);
        }
        return skip(start, start + 2, ">", true);
    }

    // An element start tag: open unless it ends in "/>" however its quotes are read. The same
    // as skip(start, start + 1, ">", true), with both ends found once.
    std::size_t tag(std::size_t start) {
        std::size_t honoured = find(start + 1, ">", true);
        std::size_t plain = find(start + 1, ">", false);
        bool selfClosing = honoured != npos && plain != npos && xml_[honoured - 1] == '/' &&
                           xml_[plain - 1] == '/';
        ++elements_;
        if (!selfClosing) {
            ++depth_;
        }
        if (honoured == npos) {
            uncertain(start + 1, xml_.size());
            return xml_.size();
        }
        uncertain(plain, honoured);
        return honoured + 1;
    }

    // Text that libplist may or may not read as markup: every '<' that could start an element
    // counts as an open element.
    void uncertain(std::size_t from, std::size_t to) {
        for (std::size_t at = from; at < to && at < xml_.size(); ++at) {
            if (xml_[at] == '<' && at + 1 < xml_.size() && xml_[at + 1] != '/') {
                ++depth_;
                ++elements_;
            }
        }
    }

    std::string_view xml_;
    std::size_t depth_ = 0;
    std::size_t elements_ = 0;
};

// What one binary object becomes once libplist has copied every shared reference.
// Kept small: one is held for every object of the document. The limits keep each count far
// below 2^32.
struct Expansion {
    enum State : std::uint8_t { kUnseen, kWalking, kDone };
    std::uint32_t nodes = 0;
    std::uint32_t payloadBytes = 0;
    std::uint16_t height = 0;
    State state = kUnseen;
};

// Walks the objects of a binary property list from the top object along their references,
// with the expansion of each object remembered so that shared objects cost one visit.
class BinaryWalk {
  public:
    explicit BinaryWalk(std::string_view bytes) : bytes_(bytes) {}

    Result<> run() {
        static constexpr std::size_t kHeader = 8;
        static constexpr std::size_t kTrailer = 32;
        if (bytes_.size() < kHeader + kTrailer || !bytes_.starts_with("bplist00")) {
            return Failure{"it is not a binary property list"};
        }
        std::size_t trailer = bytes_.size() - kTrailer;
        offsetSize_ = static_cast<unsigned char>(bytes_[trailer + 6]);
        refSize_ = static_cast<unsigned char>(bytes_[trailer + 7]);
        std::uint64_t objectCount = number(trailer + 8, 8);
        std::uint64_t top = number(trailer + 16, 8);
        std::uint64_t table = number(trailer + 24, 8);
        objectsEnd_ = trailer;
        if (offsetSize_ < 1 || offsetSize_ > 8 || refSize_ < 1 || refSize_ > 8 || table < kHeader ||
            table > trailer || objectCount == 0 || objectCount > (trailer - table) / offsetSize_ ||
            top >= objectCount) {
            return Failure{"its trailer is damaged"};
        }
        // Every object of a well-formed list is reached at least once, so more objects than
        // nodes would exceed the limit anyway; this also bounds the table of expansions below.
        if (objectCount > kMaxPropertyListNodes) {
            return tooManyNodes();
        }
        table_ = table;
        objectCount_ = objectCount;
        expansions_.assign(objectCount, Expansion{});
        Expansion root;
        if (Result<> failure = walk(top, 1, root); !failure) {
            return failure;
        }
        return {};
    }

  private:
    // A big-endian unsigned number of width bytes at at (within bounds by the caller).
    std::uint64_t number(std::size_t at, std::size_t width) const {
        std::uint64_t value = 0;
        for (std::size_t i = 0; i < width; ++i) {
            value = (value << 8) | static_cast<unsigned char>(bytes_[at + i]);
        }
        return value;
    }

    // The length of the object whose marker is at marker and where its contents start.
    Result<> length(std::size_t marker, std::uint64_t& count, std::size_t& contents) const {
        count = static_cast<unsigned char>(bytes_[marker]) & 0x0F;
        contents = marker + 1;
        if (count != 0x0F) {
            return {};
        }
        if (contents >= objectsEnd_) {
            return Failure{"an object runs past the end"};
        }
        auto intMarker = static_cast<unsigned char>(bytes_[contents]);
        std::size_t width = std::size_t{1} << (intMarker & 0x0F);
        if ((intMarker & 0xF0) != 0x10 || width > 8 || objectsEnd_ - contents - 1 < width) {
            return Failure{"an object has a damaged length"};
        }
        count = number(contents + 1, width);
        contents += 1 + width;
        return {};
    }

    bool fits(std::size_t contents, std::uint64_t size) const {
        return contents <= objectsEnd_ && size <= objectsEnd_ - contents;
    }

    Result<> walk(std::uint64_t index, std::size_t depth, Expansion& out) {
        if (depth > kMaxPropertyListDepth) {
            return tooDeep();
        }
        Expansion& known = expansions_[index];
        if (known.state == Expansion::kWalking) {
            return Failure{"an object contains itself"};
        }
        if (known.state == Expansion::kDone) {
            out = known;
            return {};
        }
        known.state = Expansion::kWalking;
        Expansion expansion;
        if (Result<> failure = expand(index, depth, expansion); !failure) {
            return failure;
        }
        expansion.state = Expansion::kDone;
        expansions_[index] = expansion;
        out = expansion;
        return {};
    }

    Result<> expand(std::uint64_t index, std::size_t depth, Expansion& out) {
        std::uint64_t offset = number(table_ + index * offsetSize_, offsetSize_);
        if (offset < 8 || offset >= objectsEnd_) {
            return Failure{"an object offset points outside the objects"};
        }
        auto marker = static_cast<std::size_t>(offset);
        auto kind = static_cast<unsigned char>(bytes_[marker]) >> 4;
        out = Expansion{1, 0, 1, Expansion::kUnseen};
        std::uint64_t count = 0;
        std::size_t contents = 0;
        switch (kind) {
            case 0x0:  // null, booleans, fill
                return {};
            case 0x1:  // integer
            case 0x2:  // real
                if (!fits(marker + 1, std::uint64_t{1} << (bytes_[marker] & 0x0F))) {
                    return Failure{"a number runs past the end"};
                }
                return {};
            case 0x3:  // date
                return fits(marker + 1, 8) ? Result<>() : Failure{"a date runs past the end"};
            case 0x8:  // uid
                return fits(marker + 1, (bytes_[marker] & 0x0F) + 1u)
                           ? Result<>()
                           : Failure{"a uid runs past the end"};
            case 0x4:  // data
            case 0x5:  // ASCII string
            case 0x6:  // UTF-16 string
            case 0x7: {
                if (Result<> failure = length(marker, count, contents); !failure) {
                    return failure;
                }
                std::uint64_t size = kind == 0x6 ? count * 2 : count;
                if (count > objectsEnd_ || !fits(contents, size)) {
                    return Failure{"a string or data object runs past the end"};
                }
                std::string_view text = bytes_.substr(contents, static_cast<std::size_t>(size));
                if (kind != 0x4 && hasNul(text, kind == 0x6)) {
                    return Failure{"a string holds a NUL character"};
                }
                // UTF-16 becomes up to three UTF-8 bytes per unit.
                out.payloadBytes = static_cast<std::uint32_t>(kind == 0x6 ? count * 3 : count);
                return {};
            }
            case 0xA:  // array
            case 0xB:  // ordered set
            case 0xC:  // set
            case 0xD: {
                if (Result<> failure = length(marker, count, contents); !failure) {
                    return failure;
                }
                std::uint64_t refs = kind == 0xD ? count * 2 : count;
                if (count > objectsEnd_ || !fits(contents, refs * refSize_)) {
                    return Failure{"a container runs past the end"};
                }
                for (std::uint64_t i = 0; i < refs; ++i) {
                    std::uint64_t child = number(contents + i * refSize_, refSize_);
                    if (child >= objectCount_) {
                        return Failure{"a reference points to no object"};
                    }
                    if (kind == 0xD && i < count && !isString(child)) {
                        return Failure{"a dictionary key is not a string"};
                    }
                    Expansion part;
                    if (Result<> failure = walk(child, depth + 1, part); !failure) {
                        return failure;
                    }
                    out.nodes += part.nodes;
                    out.payloadBytes += part.payloadBytes;
                    out.height = std::max<std::uint16_t>(out.height, part.height + 1);
                    if (out.nodes > kMaxPropertyListNodes) {
                        return tooManyNodes();
                    }
                    if (out.payloadBytes > kMaxPropertyListPayloadBytes) {
                        return Failure{"its strings and data exceed " +
                                       std::to_string(kMaxPropertyListPayloadBytes) + " bytes"};
                    }
                    if (depth + part.height > kMaxPropertyListDepth) {
                        return tooDeep();
                    }
                }
                return {};
            }
            default:
                return Failure{"it holds an object of unknown type"};
        }
    }

    bool isString(std::uint64_t index) const {
        std::uint64_t offset = number(table_ + index * offsetSize_, offsetSize_);
        if (offset >= objectsEnd_) {
            return false;
        }
        auto kind = static_cast<unsigned char>(bytes_[static_cast<std::size_t>(offset)]) >> 4;
        return kind == 0x5 || kind == 0x6 || kind == 0x7;
    }

    static bool hasNul(std::string_view text, bool utf16) {
        if (!utf16) {
            return text.find('\0') != std::string_view::npos;
        }
        for (std::size_t i = 0; i + 1 < text.size(); i += 2) {
            if (text[i] == '\0' && text[i + 1] == '\0') {
                return true;
            }
        }
        return false;
    }

    std::string_view bytes_;
    std::size_t offsetSize_ = 0;
    std::size_t refSize_ = 0;
    std::size_t table_ = 0;
    std::size_t objectsEnd_ = 0;
    std::uint64_t objectCount_ = 0;
    // Indexed by object; the trailer check bounds the object count.
    std::vector<Expansion> expansions_;
};

}  // namespace

Result<> checkXmlBounds(std::string_view xml) {
    return XmlScan(xml).run();
}

Result<> checkBinaryBounds(std::string_view bytes) {
    return BinaryWalk(bytes).run();
}

}  // namespace tavrix::plist

#include "bundle/GzipInflater.h"

#include <zlib.h>

#include <algorithm>
#include <climits>
#include <memory>
#include <utility>

namespace tavrix {
namespace {

// 16 + MAX_WBITS: a gzip header and trailer, not a bare zlib stream.
constexpr int kGzipWindowBits = 16 + MAX_WBITS;
constexpr std::size_t kInitialOutputBytes = 16 * 1024;

struct InflateEnd {
    void operator()(z_stream* stream) const { inflateEnd(stream); }
};

}  // namespace

bool inflateGzip(std::span<const std::uint8_t> compressed, plist::Data& out, std::size_t maxBytes) {
    z_stream stream{};
    if (inflateInit2(&stream, kGzipWindowBits) != Z_OK) {
        return false;
    }
    std::unique_ptr<z_stream, InflateEnd> streamOwner(&stream);

    plist::Data inflated(std::min(maxBytes, std::max(kInitialOutputBytes, compressed.size() * 4)));
    std::size_t produced = 0;
    std::size_t consumed = 0;
    for (;;) {
        if (produced == inflated.size()) {
            if (inflated.size() >= maxBytes) {
                return false;
            }
            inflated.resize(std::min(maxBytes, inflated.size() * 2));
        }
        // zlib counts in 32-bit units; larger spans are fed in pieces.
        std::size_t inputChunk = std::min<std::size_t>(compressed.size() - consumed, UINT_MAX);
        std::size_t outputChunk = std::min<std::size_t>(inflated.size() - produced, UINT_MAX);
        stream.next_in = const_cast<Bytef*>(compressed.data() + consumed);
        stream.avail_in = static_cast<uInt>(inputChunk);
        stream.next_out = inflated.data() + produced;
        stream.avail_out = static_cast<uInt>(outputChunk);
        int status = inflate(&stream, Z_NO_FLUSH);
        consumed += inputChunk - stream.avail_in;
        produced += outputChunk - stream.avail_out;
        if (status == Z_STREAM_END) {
            inflated.resize(produced);
            out = std::move(inflated);
            return true;
        }
        // Without output room zlib answers Z_BUF_ERROR and the next pass grows the buffer; with
        // room left it means the input ended before the stream did.
        if (status == Z_BUF_ERROR && produced == inflated.size()) {
            continue;
        }
        if (status != Z_OK) {
            return false;
        }
    }
}

}  // namespace tavrix

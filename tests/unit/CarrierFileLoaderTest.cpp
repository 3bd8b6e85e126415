#include <gtest/gtest.h>
#include <zlib.h>

#include <cstdlib>
#include <span>
#include <string>
#include <utility>
#include <vector>

#include "LocalHttpServer.h"
#include "TestSupport.h"
#include "bundle/CarrierFileLoader.h"
#include "bundle/GzipInflater.h"
#include "plist/PropertyListFormat.h"
#include "util/SystemLog.h"

namespace tavrix {
namespace {

using Line = std::pair<int, std::string>;

const plist::Value kCarrier(plist::Dictionary{
    {"CarrierName", "Zed"},
    {"Nested", plist::Dictionary{{"List", plist::Array{1, 2, 3}}}},
});

std::string gzipped(const std::string& bytes) {
    z_stream stream{};
    EXPECT_EQ(deflateInit2(&stream, Z_BEST_COMPRESSION, Z_DEFLATED, 16 + MAX_WBITS, 8,
                           Z_DEFAULT_STRATEGY),
              Z_OK);
    std::string out(deflateBound(&stream, bytes.size()), '\0');
    stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(bytes.data()));
    stream.avail_in = static_cast<uInt>(bytes.size());
    stream.next_out = reinterpret_cast<Bytef*>(out.data());
    stream.avail_out = static_cast<uInt>(out.size());
    EXPECT_EQ(deflate(&stream, Z_FINISH), Z_STREAM_END);
    out.resize(stream.total_out);
    deflateEnd(&stream);
    return out;
}

// The loader's lines carry their own priorities.
class CarrierFileLoaderTest : public testing::Test {
  protected:
    std::vector<Line> lines() const {
        std::vector<Line> lines;
        for (std::size_t i = 0; i < sink.messages().size(); ++i) {
            lines.emplace_back(sink.priorities()[i], sink.messages()[i]);
        }
        return lines;
    }

    test::TempDir dir;
    CapturingLogSink sink;
    ScopedLogSink guard{sink};
};

// Dictionaries load from any path (either format: the reader's own test); other content yields
// nothing silently, and only a file that cannot be read is logged, at error priority.
TEST_F(CarrierFileLoaderTest, LocalFilesLoadOnlyWhenTheyHoldADictionary) {
    // Spaces, '%', '+' and non-ASCII bytes must survive the trip through a file URL.
    for (const std::string name :
         {"behavior.plist", "dir with space/a%20b+c.plist", "d\xC3\xA9j\xC3\xA0/x#y?.plist"}) {
        test::writeText(dir / name, plist::serialize(kCarrier, plist::Format::Binary));
        EXPECT_EQ(copyDictionaryFromFile(dir / name), kCarrier) << name;
    }
    for (const std::string& content :
         {plist::serialize(plist::Value(plist::Array{"a", "b"})),
          plist::serialize(plist::Value("text"), plist::Format::Binary), std::string(),
          std::string("<plist><dict><key>cut")}) {
        test::writeText(dir / "carrier.plist", content);
        EXPECT_FALSE(copyDictionaryFromFile(dir / "carrier.plist")) << content;
    }
    EXPECT_TRUE(lines().empty());

    EXPECT_FALSE(copyDictionaryFromFile(dir / "missing.plist"));
    EXPECT_FALSE(copyDictionaryFromFile(dir.path().string()));  // a directory
    EXPECT_FALSE(copyDictionaryFromFile(""));
    EXPECT_EQ(lines(), (std::vector<Line>{{LOG_ERR, "Failed to load the file\n"},
                                          {LOG_ERR, "Failed to load the file\n"},
                                          {LOG_ERR, "Failed to get the URL for the file \n"}}));
}

// Over HTTP whatever body arrives is the file: gzip (named in any letter case) is inflated, no
// encoding is taken as it is, any other encoding or a broken gzip body yields nothing, an error
// page parses to nothing, and only a broken transfer is a failure.
TEST_F(CarrierFileLoaderTest, HttpBodiesAreTheFileWhateverTheStatus) {
    // A proxy from the environment must not stand between the loader and the local server.
    ::setenv("no_proxy", "127.0.0.1", 1);
    ::setenv("NO_PROXY", "127.0.0.1", 1);
    test::LocalHttpServer server;
    const std::string xml = plist::serialize(kCarrier);
    const std::string compressed = gzipped(xml);
    plist::Dictionary large;
    for (int i = 0; i < 5000; ++i) {
        large.emplace("Key" + std::to_string(i), std::string(20, 'a' + i % 26));
    }
    const std::string largeXml = plist::serialize(plist::Value(large));
    ASSERT_GT(largeXml.size(), 100000u);
    auto response = [](std::string body, std::vector<std::pair<std::string, std::string>> headers,
                       int status = 200) {
        test::LocalHttpServer::Response response;
        response.body = std::move(body);
        response.headers = std::move(headers);
        response.status = status;
        return response;
    };
    test::LocalHttpServer::Response cut = response(xml, {});
    cut.cutAfterBodyBytes = xml.size() / 2;
    test::LocalHttpServer::Response moved = response("", {}, 302);
    moved.reason = "Found";
    // The redirect's own encoding must not decide how the final body is read.
    moved.headers = {{"Location", "/large"}, {"Content-Encoding", "deflate"}};
    struct Case {
        const char* path;
        test::LocalHttpServer::Response response;
        std::optional<plist::Value> loaded;
    };
    const std::vector<Case> cases{
        {"/gzip", response(compressed, {{"Content-Encoding", "gzip"}}), kCarrier},
        {"/mixed", response(compressed, {{"content-encoding", "x-GZip"}}), kCarrier},
        {"/large", response(largeXml, {}), plist::Value(large)},
        {"/redirected", moved, plist::Value(large)},
        {"/compress", response(xml, {{"Content-Encoding", "compress"}}), std::nullopt},
        {"/damaged", response(xml, {{"Content-Encoding", "gzip"}}), std::nullopt},
        {"/empty", response("", {{"Content-Encoding", "gzip"}}), std::nullopt},
        {"/missing", response("404 Not Found", {}, 404), std::nullopt},
        {"/cut", cut, std::nullopt},
    };
    for (const Case& c : cases) {
        server.serve(c.path, c.response);
    }
    for (const Case& c : cases) {
        EXPECT_EQ(copyPropertyListFromURL(server.url(c.path), kCarrierFileSourceRemote), c.loaded)
            << c.path;
    }
    // A transfer that ended well answers true even with nothing to show.
    std::optional<plist::Data> data{plist::Data{1}};
    EXPECT_TRUE(copyDataFromHTTP(server.url("/compress"), &data));
    EXPECT_FALSE(data);
    EXPECT_FALSE(copyDataFromHTTP(server.url("/gzip"), nullptr));
    const test::LocalHttpServer::Request request = server.requests().front();
    EXPECT_EQ(request.method, "GET");
    EXPECT_EQ(request.version, "HTTP/1.0");
    EXPECT_EQ(request.header("Accept-Encoding"), "compress, gzip");
    // Only HTTP is fetched over the remote source.
    test::writeText(dir / "local.plist", xml);
    EXPECT_FALSE(
        copyPropertyListFromURL("file://" + dir / "local.plist", kCarrierFileSourceRemote));
}

TEST(GzipInflaterTest, RefusesResultsBeyondTheCap) {
    std::string zeros(1 << 20, '\0');
    std::string compressed = gzipped(zeros);
    std::span<const std::uint8_t> input(reinterpret_cast<const std::uint8_t*>(compressed.data()),
                                        compressed.size());
    plist::Data out{7};
    EXPECT_FALSE(inflateGzip(input, out, zeros.size() - 1));
    EXPECT_EQ(out, plist::Data{7});
    EXPECT_TRUE(inflateGzip(input, out, zeros.size()));
    EXPECT_EQ(out.size(), zeros.size());
    // Cut input never inflates, whatever the room.
    EXPECT_FALSE(inflateGzip(input.first(input.size() - 4), out));
}

}  // namespace
}  // namespace tavrix

#include <gtest/gtest.h>
#include <zlib.h>

#include <cstdlib>
#include <mutex>
#include <span>
#include <string>
#include <utility>
#include <vector>

#include "LocalHttpServer.h"
#include "TestSupport.h"
#include "bundle/CarrierFileLoader.h"
#include "bundle/GzipInflater.h"
#include "util/SystemLog.h"
#include "plist/PropertyListFormat.h"

namespace tavrix {
namespace {

using Line = std::pair<int, std::string>;

// Keeps each message with its priority: the loader's lines carry their own.
class PrioritySink : public LogSink {
  public:
    void write(int priority, std::string_view message) override {
        std::lock_guard lock(mutex_);
        lines_.emplace_back(priority, std::string(message));
    }
    std::vector<Line> lines() const {
        std::lock_guard lock(mutex_);
        return lines_;
    }

  private:
    mutable std::mutex mutex_;
    std::vector<Line> lines_;
};

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

class CarrierFileLoaderTest : public testing::Test {
  protected:
    test::TempDir dir;
    PrioritySink sink;
    ScopedLogSink guard{sink};
};

TEST_F(CarrierFileLoaderTest, LoadsDictionariesInEitherFormatFromAnyPath) {
    // Spaces, '%', '+' and non-ASCII bytes must survive the trip through a file URL.
    for (const std::string name :
         {"behavior.plist", "dir with space/a%20b+c.plist", "d\xC3\xA9j\xC3\xA0/x#y?.plist"}) {
        for (plist::Format format : {plist::Format::Xml, plist::Format::Binary}) {
            std::string path = dir / name;
            test::writeText(path, plist::serialize(kCarrier, format));
            std::optional<plist::Value> loaded = copyDictionaryFromFile(path);
            ASSERT_TRUE(loaded) << name;
            EXPECT_EQ(*loaded, kCarrier);
        }
    }
    EXPECT_TRUE(sink.lines().empty());
}

TEST_F(CarrierFileLoaderTest, UnreadableFilesLogAtErrorPriority) {
    EXPECT_FALSE(copyDictionaryFromFile(dir / "missing.plist"));
    EXPECT_FALSE(copyDictionaryFromFile(dir.path().string()));  // a directory
    EXPECT_FALSE(copyDictionaryFromFile(""));
    EXPECT_EQ(sink.lines(),
              (std::vector<Line>{{LOG_ERR, "Failed to load the file\n"},
                                 {LOG_ERR, "Failed to load the file\n"},
                                 {LOG_ERR, "Failed to get the URL for the file \n"}}));
}

TEST_F(CarrierFileLoaderTest, ContentThatIsNoDictionaryYieldsNothingSilently) {
    const std::vector<std::string> contents = {
        plist::serialize(plist::Value(plist::Array{"a", "b"})),
        plist::serialize(plist::Value("just a string"), plist::Format::Binary),
        "",
        "<plist><dict><key>cut",
        "\x00\x01garbage",
    };
    for (const std::string& content : contents) {
        test::writeText(dir / "carrier.plist", content);
        EXPECT_FALSE(copyDictionaryFromFile(dir / "carrier.plist"));
    }
    EXPECT_TRUE(sink.lines().empty());
}

class CarrierFileHttpTest : public CarrierFileLoaderTest {
  protected:
    void SetUp() override {
        // A proxy from the environment must not stand between the loader and the local server.
        ::setenv("no_proxy", "127.0.0.1", 1);
        ::setenv("NO_PROXY", "127.0.0.1", 1);
    }

    void serve(const std::string& path, std::string body,
               std::vector<std::pair<std::string, std::string>> headers = {}) {
        test::LocalHttpServer::Response response;
        response.body = std::move(body);
        response.headers = std::move(headers);
        server.serve(path, std::move(response));
    }

    test::LocalHttpServer server;
    const std::string xml = plist::serialize(kCarrier);
};

TEST_F(CarrierFileHttpTest, GzipBodiesAreInflatedWhateverTheLetterCase) {
    std::string compressed = gzipped(xml);
    serve("/lower", compressed, {{"Content-Encoding", "gzip"}});
    serve("/mixed", compressed, {{"content-encoding", "x-GZip"}});
    for (const char* path : {"/lower", "/mixed"}) {
        EXPECT_EQ(copyPropertyListFromURL(server.url(path), kCarrierFileSourceRemote), kCarrier);
    }
    Line sizes{LOG_NOTICE,
               "XML file retrieved, compressed size: " + std::to_string(compressed.size()) +
                   ", decompressed size: " + std::to_string(xml.size()) + "\n"};
    EXPECT_EQ(sink.lines(), (std::vector<Line>{sizes, sizes}));
}

TEST_F(CarrierFileHttpTest, PlainBodiesAreTakenWholeAcrossManyReads) {
    plist::Dictionary large;
    for (int i = 0; i < 5000; ++i) {
        large.emplace("Key" + std::to_string(i), std::string(20, 'a' + i % 26));
    }
    std::string body = plist::serialize(plist::Value(large));
    ASSERT_GT(body.size(), 100000u);
    serve("/large.plist", body);
    EXPECT_EQ(copyPropertyListFromURL(server.url("/large.plist"), kCarrierFileSourceRemote),
              plist::Value(large));
    EXPECT_EQ(sink.lines(),
              (std::vector<Line>{{LOG_NOTICE, "XML file retrieved, file size: " +
                                                  std::to_string(body.size()) + "\n"}}));
}

TEST_F(CarrierFileHttpTest, RequestIsHttp10OfferingCompressAndGzip) {
    serve("/carrier.plist", xml);
    std::optional<plist::Data> data;
    EXPECT_TRUE(copyDataFromHTTP(server.url("/carrier.plist"), &data));
    std::vector<test::LocalHttpServer::Request> requests = server.requests();
    ASSERT_EQ(requests.size(), 1u);
    EXPECT_EQ(requests[0].method, "GET");
    EXPECT_EQ(requests[0].version, "HTTP/1.0");
    EXPECT_EQ(requests[0].header("Accept-Encoding"), "compress, gzip");
    EXPECT_FALSE(copyDataFromHTTP(server.url("/carrier.plist"), nullptr));
}

TEST_F(CarrierFileHttpTest, OtherEncodingsAndBadGzipYieldNothingSilently) {
    serve("/deflate", xml, {{"Content-Encoding", "deflate"}});
    serve("/compress", xml, {{"Content-Encoding", "compress"}});
    serve("/damaged", xml, {{"Content-Encoding", "gzip"}});
    serve("/empty", "", {{"Content-Encoding", "gzip"}});
    for (const char* path : {"/deflate", "/compress", "/damaged", "/empty"}) {
        std::optional<plist::Data> data{plist::Data{1}};
        EXPECT_TRUE(copyDataFromHTTP(server.url(path), &data)) << path;
        EXPECT_FALSE(data) << path;
        EXPECT_FALSE(copyPropertyListFromURL(server.url(path), kCarrierFileSourceRemote));
    }
    EXPECT_TRUE(sink.lines().empty());
}

TEST_F(CarrierFileHttpTest, ErrorPagesAreTakenAsTheBodyAndParseToNothing) {
    std::optional<plist::Data> data;
    EXPECT_TRUE(copyDataFromHTTP(server.url("/nowhere.plist"), &data));
    ASSERT_TRUE(data);
    EXPECT_NE(std::string(data->begin(), data->end()).find("404 Not Found"), std::string::npos);
    EXPECT_FALSE(copyPropertyListFromURL(server.url("/nowhere.plist"), kCarrierFileSourceRemote));
    for (const Line& line : sink.lines()) {
        EXPECT_EQ(line.first, LOG_NOTICE);
        EXPECT_TRUE(line.second.starts_with("XML file retrieved, file size: "));
    }
}

TEST_F(CarrierFileHttpTest, RedirectsAreFollowedToTheFinalResponse) {
    test::LocalHttpServer::Response moved;
    moved.status = 302;
    moved.reason = "Found";
    // The redirect's own encoding must not decide how the final body is read.
    moved.headers = {{"Location", "/final.plist.gz"}, {"Content-Encoding", "deflate"}};
    server.serve("/start", moved);
    test::writeText(dir / "final.plist.gz", gzipped(xml));
    server.serveDirectory("/", dir.path());
    // The directory server sends no encoding, so the final response is taken as it is; the gzip
    // bytes are no property list.
    std::optional<plist::Data> data;
    EXPECT_TRUE(copyDataFromHTTP(server.url("/start"), &data));
    ASSERT_TRUE(data);
    EXPECT_EQ(std::string(data->begin(), data->end()), gzipped(xml));
    ASSERT_EQ(server.requests().size(), 2u);
    EXPECT_EQ(server.requests()[1].target, "/final.plist.gz");
}

TEST_F(CarrierFileHttpTest, BrokenTransfersFailAndAreLogged) {
    test::LocalHttpServer::Response cut;
    cut.body = xml;
    cut.cutAfterBodyBytes = xml.size() / 2;
    server.serve("/cut", cut);
    std::optional<plist::Data> data;
    EXPECT_FALSE(copyDataFromHTTP(server.url("/cut"), &data));
    EXPECT_FALSE(data);
    EXPECT_FALSE(copyPropertyListFromURL(server.url("/cut"), kCarrierFileSourceRemote));
    // Only HTTP is fetched over the remote source.
    test::writeText(dir / "local.plist", xml);
    EXPECT_FALSE(
        copyPropertyListFromURL("file://" + dir / "local.plist", kCarrierFileSourceRemote));
    EXPECT_EQ(sink.lines(), (std::vector<Line>{{LOG_ERR, "Failed to load the file\n"},
                                               {LOG_ERR, "Failed to load the file\n"}}));
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

#include <gtest/gtest.h>

#include <string>

#include "catalog/Sha256.h"
#include "util/SharedLibrary.h"

namespace tavrix::catalog {
namespace {

// The digest is libcrypto's, loaded on first use: known vectors, fed in pieces that cross its
// 64-byte blocks, catch a wrong binding or a lost piece.
TEST(Sha256, MatchesKnownDigestsFedInPieces) {
    Sha256Digest empty;
    EXPECT_EQ(empty.finishHex(),
              "e3b0c44298fc1c149afbf4c8996fb92427ae41e4649b934ca495991b7852b855");

    const std::string text = "abcdbcdecdefdefgefghfghighijhijkijkljklmklmnlmnomnopnopq";
    Sha256Digest pieces;
    for (std::size_t at = 0; at < text.size(); at += 7) {
        pieces.update(std::string_view(text).substr(at, 7));
    }
    EXPECT_EQ(pieces.finishHex(),
              "248d6a61d20638b8e5c026930c3e6039a33ce45964ff2167f6ecedd419db06c1");
}

// A missing optional library fails the operation that needs it with a reason naming it.
TEST(SharedLibrary, MissingLibraryOrSymbolSaysWhich) {
    std::string error;
    EXPECT_EQ(SharedLibrary::open("libtavrix-absent.so.1", error), nullptr);
    EXPECT_NE(error.find("libtavrix-absent.so.1"), std::string::npos) << error;

    auto library = SharedLibrary::open("libcrypto.so.3", error);
    ASSERT_NE(library, nullptr) << error;
    void (*function)() = nullptr;
    EXPECT_FALSE(library->bind(function, "no_such_function_here", error));
    EXPECT_EQ(error, "libcrypto.so.3 has no no_such_function_here");
}

}  // namespace
}  // namespace tavrix::catalog

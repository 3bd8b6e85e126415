// Shared helpers for the unit tests: temporary directories and small file helpers.
#pragma once

#include <filesystem>
#include <fstream>
#include <string>

namespace tavrix::test {

// A fresh directory under $TMPDIR, removed with everything in it when the object goes.
class TempDir {
  public:
    TempDir() {
        std::string pattern =
            (std::filesystem::temp_directory_path() / "tavrix-test-XXXXXX").string();
        if (::mkdtemp(pattern.data()) == nullptr) {
            throw std::runtime_error("mkdtemp failed");
        }
        path_ = pattern;
    }
    ~TempDir() {
        std::error_code ignored;
        std::filesystem::remove_all(path_, ignored);
    }
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;

    const std::filesystem::path& path() const { return path_; }
    std::string operator/(const std::string& relative) const { return (path_ / relative).string(); }

  private:
    std::filesystem::path path_;
};

inline void writeText(const std::string& path, const std::string& text) {
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    std::ofstream(path, std::ofstream::binary) << text;
}

inline std::string readText(const std::string& path) {
    std::ifstream in(path, std::ofstream::binary);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

}  // namespace tavrix::test

#pragma once

#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <stdexcept>
#include <string>
#include <string_view>
#include <system_error>

namespace test {

/// A directory of its own for one test, under the system's temporary directory; it goes, with
/// everything in it, when the object does. Its path is canonical.
class TemporaryDirectory {
  public:
    TemporaryDirectory() {
        std::string name = std::filesystem::canonical(std::filesystem::temp_directory_path()) /
                           "zorvan-test-XXXXXX";
        if (!::mkdtemp(name.data())) throw std::runtime_error("cannot make " + name);
        path_ = name;
    }
    TemporaryDirectory(const TemporaryDirectory&) = delete;
    TemporaryDirectory& operator=(const TemporaryDirectory&) = delete;
    ~TemporaryDirectory() {
        std::error_code ignored;
        std::filesystem::remove_all(path_, ignored);
    }

    const std::string& path() const { return path_; }
    std::string path(std::string_view relative) const {
        return path_ + "/" + std::string(relative);
    }

    /// Writes a file, in place, and makes the directories above it. Answers its path.
    std::string write(std::string_view relative, std::string_view bytes) const {
        const std::string file = path(relative);
        std::filesystem::create_directories(std::filesystem::path(file).parent_path());
        std::ofstream stream(file, std::ios::binary | std::ios::trunc);
        stream << bytes;
        stream.close();
        if (!stream) throw std::runtime_error("cannot write " + file);
        return file;
    }

    /// Makes a directory and those above it. Answers its path.
    std::string makeDirectory(std::string_view relative) const {
        std::filesystem::create_directories(path(relative));
        return path(relative);
    }

    /// A path of exactly so many bytes, for something in a directory that is there.
    std::string pathOfLength(std::size_t length) const {
        std::string directory = path_;
        while (length - directory.size() > 250) directory += "/" + std::string(200, 'd');
        std::filesystem::create_directories(directory);
        return directory + "/" + std::string(length - directory.size() - 1, 'x');
    }

  private:
    std::string path_;
};

}  // namespace test

#include "tests/support/temp_root.h"

#include <sys/stat.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>

namespace test {

namespace fs = std::filesystem;

TempFolder::TempFolder() {
    std::string pattern = fs::temp_directory_path() / "zel_test.XXXXXX";
    if (mkdtemp(pattern.data()) == nullptr) {
        throw std::runtime_error("cannot make " + pattern);
    }
    path_ = pattern;
}

TempFolder::~TempFolder() {
    std::error_code ignored;
    fs::remove_all(path_, ignored);
}

std::string TempFolder::Path(const std::string& name) const {
    return name.empty() ? path_ : path_ + "/" + name;
}

std::string TempFolder::Write(const std::string& name, const std::string& content) const {
    const fs::path file = Path(name);
    fs::create_directories(file.parent_path());
    std::ofstream(file, std::ios::binary) << content;
    return file;
}

TempRoot::TempRoot() {
    for (const char* folder : {"usr/tarq/etc", "var/run", "var/log", "tmp/ZEL"}) {
        fs::create_directories(Path(folder));
    }
    setenv("TARQ_ROOT", Path().c_str(), 1);
}

TempRoot::~TempRoot() {
    unsetenv("TARQ_ROOT");
}

std::string ReadFile(const std::string& path) {
    // What cannot be read, of a process that has just ended for example, is left out.
    std::ostringstream text;
    text << std::ifstream(path, std::ios::binary).rdbuf();
    return text.str();
}

unsigned int ModeOf(const std::string& path) {
    struct stat info = {};
    return stat(path.c_str(), &info) == 0 ? info.st_mode & 07777 : 0;
}

}  // namespace test

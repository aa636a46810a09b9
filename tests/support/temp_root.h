#pragma once

#include <string>

namespace test {

/// A folder of its own below the system's temporary folder, removed with all that is in it at the
/// end.
class TempFolder {
public:
    TempFolder();
    ~TempFolder();
    TempFolder(const TempFolder&) = delete;
    TempFolder& operator=(const TempFolder&) = delete;

    /// The folder's path, or the path of `name` in it.
    std::string Path(const std::string& name = "") const;
    /// Writes a file, with the folders on its way; returns its path.
    std::string Write(const std::string& name, const std::string& content) const;

private:
    std::string path_;
};

/// A TempFolder that is the system's root (TARQ_ROOT) while it lives, with the folders that the
/// system expects.
class TempRoot : public TempFolder {
public:
    TempRoot();
    ~TempRoot();
};

/// The whole file; empty when it cannot be read.
std::string ReadFile(const std::string& path);

/// Who may do what with a file; 0 where there is none.
unsigned int ModeOf(const std::string& path);

}  // namespace test

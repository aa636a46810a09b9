#pragma once

#include <sqlite3.h>
#include <sys/types.h>

#include <cerrno>
#include <cstddef>
#include <iterator>
#include <vector>

namespace test {

/// Makes every write of SQLite fail as on a full disk while it lives.
class FullDisk {
public:
    FullDisk() {
        for (const char* name : kNames) {
            real_.push_back(vfs_->xGetSystemCall(vfs_, name));
        }
        Set([](size_t) { return reinterpret_cast<sqlite3_syscall_ptr>(&Fail); });
    }
    ~FullDisk() {
        Set([&](size_t i) { return real_[i]; });
    }

private:
    static constexpr const char* kNames[] = {"write", "pwrite", "pwrite64"};

    static ssize_t Fail(int, const void*, size_t, off64_t) {
        errno = ENOSPC;
        return -1;
    }
    template <typename Call>
    void Set(Call call) {
        for (size_t i = 0; i < std::size(kNames); ++i) {
            if (real_[i] != nullptr) {
                vfs_->xSetSystemCall(vfs_, kNames[i], call(i));
            }
        }
    }

    sqlite3_vfs* const vfs_ = sqlite3_vfs_find(nullptr);
    std::vector<sqlite3_syscall_ptr> real_;
};

}  // namespace test

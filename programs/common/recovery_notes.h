// How far a recovery has come, so that one that broke off goes on.
#pragma once

#include <set>
#include <string>

namespace programs {

/// A small file in /usr/tarq/etc, there as long as something is left to do. Throws Failure (kLocal)
/// when it cannot be written.
class RecoveryNotes {
public:
    /// Reads what is there.
    RecoveryNotes();

    /// Whether tasks are still to be resumed. When none is, nothing is known of the rest either.
    bool IsUnderWay();

    /// What the recovery takes the configuration from, a word of the caller's.
    const std::string& Deposit() const { return deposit_; }
    /// To be noted with the next task.
    void SetDeposit(const std::string& deposit) { deposit_ = deposit; }

    /// Tasks that a recovery has added paused, and that are still to be resumed.
    const std::set<std::string>& Tasks() const { return tasks_; }
    /// Whether all files of the share came back.
    bool IsBack(const std::string& share) const { return shares_.count(share) != 0; }

    /// Before the task is there: whatever happens then, it is known whose pause that is.
    void AddTask(const std::string& task);
    void ShareIsBack(const std::string& share);
    /// With the last task the file is gone.
    void RemoveTask(const std::string& task);

private:
    void Write() const;

    std::string deposit_;
    std::set<std::string> tasks_;
    std::set<std::string> shares_;
};

}  // namespace programs

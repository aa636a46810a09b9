#include "programs/common/recovery_notes.h"

#include <unistd.h>

#include <string_view>

#include "base/replace_file.h"
#include "base/section_view.h"
#include "base/whole_file.h"
#include "programs/common/failure.h"
#include "tarq/root_path.h"

namespace programs {

namespace {

constexpr size_t kMaxFile = size_t{1} << 20;

std::string File() {
    return TARQ::RootPath("/usr/tarq/etc/zel_recover");
}

}  // namespace

RecoveryNotes::RecoveryNotes() {
    const std::string text = base::ReadFile(File(), kMaxFile).value_or("");
    std::string_view rest = text;
    for (std::string_view line; base::TakeLine(rest, line);) {
        const auto pair = base::ParseKeyLine(line);
        if (pair && pair->key == "deposit") {
            deposit_ = pair->value;
        } else if (pair && pair->key == "task") {
            tasks_.emplace(pair->value);
        } else if (pair && pair->key == "share") {
            shares_.emplace(pair->value);
        }
    }
}

void RecoveryNotes::AddTask(const std::string& task) {
    if (tasks_.insert(task).second) {
        Write();
    }
}

void RecoveryNotes::ShareIsBack(const std::string& share) {
    if (shares_.insert(share).second) {
        Write();
    }
}

void RecoveryNotes::RemoveTask(const std::string& task) {
    if (tasks_.erase(task) != 0) {
        Write();
    }
}

bool RecoveryNotes::IsUnderWay() {
    if (tasks_.empty()) {
        deposit_.clear();
        shares_.clear();
    }
    return !tasks_.empty();
}

void RecoveryNotes::Write() const {
    const std::string file = File();
    if (tasks_.empty()) {
        unlink(file.c_str());
        return;
    }
    std::string text = "deposit=\"" + deposit_ + "\"\n";
    for (const std::string& task : tasks_) {
        text += "task=\"" + task + "\"\n";
    }
    for (const std::string& share : shares_) {
        text += "share=\"" + share + "\"\n";
    }
    if (!base::ReplaceFile(file, text, 0600)) {
        throw SystemFailure("cannot write " + file, FailureKind::kLocal);
    }
}

}  // namespace programs

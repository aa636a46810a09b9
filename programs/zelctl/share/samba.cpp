#include "programs/zelctl/share/samba.h"

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <optional>
#include <set>

#include "base/section_view.h"
#include "base/text.h"
#include "programs/common/failure.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/child_output.h"
#include "programs/zelctl/share/commands.h"
#include "tarq/root_path.h"
#include "tarq/share.h"

namespace zelctl {

namespace {

using programs::Failure;
using programs::FailureKind;
using programs::Printable;

namespace fs = std::filesystem;

constexpr char kCatalogue[] = "/usr/tarq/etc/tarqshare.conf";
constexpr char kRoot[] = "TARQ_ROOT";
constexpr const char* kOwnSections[] = {"global", "homes", "printers", "print$", "ipc$"};

// Samba removes double quotes around a value.
std::string Unquoted(const std::string& value) {
    return value.size() >= 2 && value.front() == '"' && value.back() == '"'
               ? value.substr(1, value.size() - 2)
               : value;
}

bool IsYes(const std::string& value) {
    const std::string folded = base::Lower(value);
    return folded == "yes" || folded == "true" || folded == "1";
}

/// One section, filled line by line.
struct Section {
    std::string name;
    std::string path;
    bool printable = false;
    bool available = true;

    void Take(const std::string& key, const std::string& value) {
        if (key == "path" || key == "directory") {
            path = Unquoted(value);
        } else if (key == "printable" || key == "print ok") {
            printable = IsYes(value);
        } else if (key == "available") {
            available = IsYes(value);
        }
    }

    bool IsShare() const {
        const auto* const own =
            std::find(std::begin(kOwnSections), std::end(kOwnSections), base::Lower(name));
        return !name.empty() && !printable && own == std::end(kOwnSections);
    }

    std::string Refusal() const {
        if (path.empty()) {
            return "it names no folder";
        }
        if (path.find('%') != std::string::npos) {
            return "its folder " + path + " is another one for each user or client";
        }
        if (path.front() != '/') {
            return "its folder " + path + " is no absolute path";
        }
        return available ? "" : "Samba has it switched off (available = no)";
    }
};

std::string FaultOfFolder(const std::string& path) {
    struct stat info = {};
    if (stat(path.c_str(), &info) != 0) {
        return "its folder " + path + " is not available: " + strerror(errno);
    }
    return S_ISDIR(info.st_mode) ? "" : path + " is no folder";
}

void ReportFailure(const std::string& text) {
    programs::Report("zelctl", text);
}

// Selects the shares in `names`, or all. False, after a report, when Samba does not have one of
// them.
bool Choose(const std::vector<std::string>& names, std::vector<SambaShare>& shares) {
    if (names.empty()) {
        return true;
    }
    std::vector<SambaShare> chosen;
    bool all = true;
    for (const std::string& name : names) {
        const auto found = std::find_if(shares.begin(), shares.end(), [&](const SambaShare& share) {
            return base::Lower(share.name) == base::Lower(name);
        });
        if (found == shares.end()) {
            ReportFailure("Samba has no share '" + Printable(name) + "'");
            all = false;
        } else {
            chosen.push_back(*found);
        }
    }
    shares = std::move(chosen);
    return all;
}

/// A copy of the catalogue that replaces the real one while this object exists: a dry run of an
/// import is an import into the copy.
class ScratchCatalogue {
public:
    ScratchCatalogue() {
        const fs::path before = TARQ::RootPath(kCatalogue);
        std::string folder = fs::temp_directory_path(error_) / "zelctl-XXXXXX";
        if (mkdtemp(folder.data()) == nullptr) {
            error_ = std::error_code(errno, std::generic_category());
            return;
        }
        folder_ = folder;
        const fs::path copy = folder + kCatalogue;
        fs::create_directories(copy.parent_path(), error_);
        if (!error_ && fs::exists(before, error_)) {
            fs::copy_file(before, copy, error_);
        }
        const char* const root = getenv(kRoot);
        root_ = root != nullptr ? std::optional<std::string>(root) : std::nullopt;
        setenv(kRoot, folder.c_str(), 1);
    }
    ~ScratchCatalogue() {
        if (folder_.empty()) {
            return;
        }
        if (root_) {
            setenv(kRoot, root_->c_str(), 1);
        } else {
            unsetenv(kRoot);
        }
        std::error_code ignored;
        fs::remove_all(folder_, ignored);
    }
    ScratchCatalogue(const ScratchCatalogue&) = delete;
    ScratchCatalogue& operator=(const ScratchCatalogue&) = delete;

    /// Why the copy could not be made, if it could not.
    const std::error_code& Error() const { return error_; }

private:
    std::error_code error_;
    fs::path folder_;
    std::optional<std::string> root_;
};

void Preview(const SambaShare& share) {
    const std::string name = Printable(share.name);
    if (TARQShareAdd(share.name.c_str(), share.path.c_str(), TARQ_SHARE_WINDOWS) < 0) {
        throw Failure(FailureKind::kLocal, "share '" + name + "' would be left out: " +
                                               (KAPICErrGet() == TARQ_ERR_BAD_PARAMETER
                                                    ? "its name or its folder cannot be a share's"
                                                    : KAPICErrText(KAPICErrGet())));
    }
    printf("Share '%s' would be %s\n", name.c_str(), Printable(share.path).c_str());
}

}  // namespace

std::vector<SambaShare> ParseSambaShares(const std::string& text) {
    std::vector<Section> sections;
    std::string_view rest = text;
    for (std::string_view line; base::TakeLine(rest, line);) {
        line = base::Trimmed(line);
        if (line.empty() || line.front() == '#' || line.front() == ';') {
            continue;
        }
        if (line.front() == '[' && line.back() == ']') {
            sections.emplace_back();
            sections.back().name = base::Trimmed(line.substr(1, line.size() - 2));
            continue;
        }
        const size_t equals = line.find('=');
        if (equals != std::string::npos && !sections.empty()) {
            sections.back().Take(base::Lower(std::string(base::Trimmed(line.substr(0, equals)))),
                                 std::string(base::Trimmed(line.substr(equals + 1))));
        }
    }
    std::vector<SambaShare> shares;
    for (const Section& section : sections) {
        if (section.IsShare()) {
            shares.push_back({section.name, section.path, section.Refusal()});
        }
    }
    return shares;
}

void ImportSambaShares(const std::string& config, const std::vector<std::string>& names,
                       bool dry_run) {
    std::vector<std::string> command = {"testparm", "-s"};
    if (!config.empty()) {
        command.push_back(config);
    }
    const ChildOutput answer = RunAndRead(command);
    if (!answer.failure.empty()) {
        throw Failure(FailureKind::kLocal,
                      Printable(answer.failure) + "; it belongs to the package samba-common-bin");
    }
    if (answer.exit_code != 0) {
        std::string errors(base::Trimmed(answer.errors));
        std::replace(errors.begin(), errors.end(), '\n', ' ');
        throw Failure(FailureKind::kLocal,
                      "testparm cannot read the configuration: " + Printable(errors));
    }
    std::vector<SambaShare> shares = ParseSambaShares(answer.output);
    bool all = Choose(names, shares);
    std::set<std::string> there;
    for (const std::string& name : ShareNames()) {
        there.insert(base::Lower(name));
    }
    std::optional<ScratchCatalogue> scratch;
    if (dry_run) {
        scratch.emplace();
        if (scratch->Error()) {
            throw Failure(FailureKind::kLocal,
                          "cannot copy the catalogue, to try the import on it: " +
                              scratch->Error().message());
        }
    }
    if (shares.empty() && all) {
        puts("Samba has no shares to take over.");
    }
    for (const SambaShare& share : shares) {
        const std::string name = Printable(share.name);
        const std::string refusal =
            share.refusal.empty() ? FaultOfFolder(share.path) : share.refusal;
        if (there.count(base::Lower(share.name)) != 0) {
            printf("Share '%s' is in the catalogue already; it stays as it is\n", name.c_str());
            continue;
        }
        try {
            if (!refusal.empty()) {
                throw Failure(FailureKind::kLocal, "share '" + name + "' " +
                                                       (dry_run ? "would be" : "is") +
                                                       " left out: " + Printable(refusal));
            }
            dry_run ? Preview(share) : AddShare(share.name, share.path, false, true);
        } catch (const Failure& failure) {
            ReportFailure(failure.what());
            all = false;
        }
    }
    if (!all) {
        throw programs::ReportedFailure(FailureKind::kLocal);
    }
}

}  // namespace zelctl

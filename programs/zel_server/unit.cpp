#include "programs/zel_server/unit.h"

#include <sys/stat.h>

#include <cstdio>
#include <sstream>

#include "programs/zel_server/shipped_unit.h"
#include "tarq/core.h"
#include "tarq/root_path.h"

namespace zel_server {

namespace {

constexpr char kSystemctl[] = "/usr/bin/systemctl";
constexpr char kManagerRuns[] = "/run/systemd/system";
// All properties that Confinement and UnitState read.
constexpr char kProperties[] =
    "--property=LoadState,ActiveState,UnitFileState,Result,ProtectSystem,ProtectHome,PrivateTmp,"
    "PrivateDevices,ProtectKernelTunables,ReadWritePaths,ReadOnlyPaths,InaccessiblePaths,"
    "TemporaryFileSystem";

struct Rule {
    const char* property;
    const char* value;
    std::vector<const char*> folders;
};

// The meaning of the manager's settings, see systemd.exec(5).
const std::vector<Rule>& Rules() {
    static const std::vector<Rule> rules = {
        {"ProtectSystem", "yes", {"/usr", "/boot", "/efi"}},
        {"ProtectSystem", "full", {"/usr", "/boot", "/efi", "/etc"}},
        {"ProtectSystem", "strict", {"/"}},
        {"ProtectHome", "yes", {"/home", "/root", "/run/user"}},
        {"ProtectHome", "read-only", {"/home", "/root", "/run/user"}},
        {"ProtectHome", "tmpfs", {"/home", "/root", "/run/user"}},
        {"PrivateTmp", "yes", {"/tmp", "/var/tmp"}},
        {"PrivateDevices", "yes", {"/dev"}},
        {"ProtectKernelTunables", "yes", {"/proc", "/sys"}},
    };
    return rules;
}

bool IsOneOf(const std::string& text, std::initializer_list<const char*> words) {
    for (const char* word : words) {
        if (text == word) {
            return true;
        }
    }
    return false;
}

bool IsWithin(const std::string& path, const std::string& folder) {
    return folder == "/" || path == folder ||
           (path.size() > folder.size() && path.compare(0, folder.size(), folder) == 0 &&
            path[folder.size()] == '/');
}

bool IsThere(const char* path) {
    struct stat info = {};
    return stat(path, &info) == 0;
}

std::string OutputOf(const char* verb, const char* option, const char* unit) {
    FILE* const stream =
        KAPICPopen(kSystemctl, "r", verb, option, unit, static_cast<const char*>(nullptr));
    std::string output;
    for (int c; stream != nullptr && (c = fgetc(stream)) != EOF;) {
        output += static_cast<char>(c);
    }
    return stream != nullptr && KAPICPclose(stream) == 0 ? output : "";
}

bool Run(const char* verb) {
    FILE* const stream =
        KAPICPopen(kSystemctl, "r", verb, "--quiet", kUnit, static_cast<const char*>(nullptr));
    return stream != nullptr && KAPICPclose(stream) == 0;
}

std::string ValueOf(const std::string& lines, const std::string& key) {
    std::istringstream stream(lines);
    for (std::string line; std::getline(stream, line);) {
        if (line.compare(0, key.size() + 1, key + "=") == 0) {
            return line.substr(key.size() + 1);
        }
    }
    return "";
}

}  // namespace

Confinement::Confinement(const std::string& lines) {
    std::istringstream stream(lines);
    for (std::string line; std::getline(stream, line);) {
        const size_t equals = line.find('=');
        const std::string key = line.substr(0, equals);
        const std::string value = equals == std::string::npos ? "" : line.substr(equals + 1);
        for (const Rule& rule : Rules()) {
            if (key == rule.property && value == rule.value) {
                for (const char* folder : rule.folders) {
                    Add(folder, line);
                }
            }
        }
        if (IsOneOf(key, {"ReadOnlyPaths", "InaccessiblePaths", "TemporaryFileSystem"})) {
            AddListed(value, key);
        } else if (key == "ReadWritePaths") {
            AddListed(value, "");
        }
    }
}

void Confinement::Add(const std::string& path, const std::string& why) {
    rules_.emplace(path, why);
}

// Paths separated by blanks, with prefixes and suffixes of systemd: "-" ignores a missing path, "+"
// makes it relative to the root folder, and options follow a ":".
void Confinement::AddListed(const std::string& paths, const std::string& why) {
    std::istringstream words(paths);
    for (std::string word; words >> word;) {
        const size_t begin = word.find('/');
        if (begin != std::string::npos) {
            Add(word.substr(begin, word.find(':') - begin), why);
        }
    }
}

std::string Confinement::Forbids(const std::string& folder) const {
    // The longest matching folder decides, whatever applies to its parents.
    const std::pair<const std::string, std::string>* nearest = nullptr;
    for (const auto& rule : rules_) {
        if (IsWithin(folder, rule.first) &&
            (nearest == nullptr || rule.first.size() > nearest->first.size())) {
            nearest = &rule;
        }
    }
    return nearest == nullptr ? "" : nearest->second;
}

UnitState AskUnit(const char* unit) {
    UnitState state;
    if (!TARQ::RootFolder().empty()) {
        return state;
    }
    state.confinement = Confinement(kShippedUnit);
    const std::string shown = IsThere(kManagerRuns) ? OutputOf("show", kProperties, unit) : "";
    const std::string load = ValueOf(shown, "LoadState");
    if (shown.empty() || load == "not-found") {
        return state;
    }
    const std::string file = ValueOf(shown, "UnitFileState");
    state.managed = true;
    state.masked = load == "masked";
    state.enabled = IsOneOf(file, {"enabled", "enabled-runtime", "alias", "static", "generated"});
    state.active = ValueOf(shown, "ActiveState");
    state.result = ValueOf(shown, "Result");
    if (load == "loaded") {
        state.confinement = Confinement(shown);
    }
    return state;
}

bool EnableUnit() {
    return Run("enable");
}

bool StartUnit() {
    return Run("start");
}

bool RestartUnit() {
    return Run("restart");
}

}  // namespace zel_server

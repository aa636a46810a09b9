#include "programs/zelctl/shares.h"

#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "ZEL/zel.h"
#include "programs/common/table.h"
#include "programs/common/text.h"
#include "programs/zelctl/prepare.h"
#include "tarq/owners.h"

namespace zelctl {

namespace {

using TARQ::ShareOwner;

ShareOwner GetShare(const std::string& name) {
    TARQShare share = nullptr;
    const int found = TARQShareGet(name.c_str(), &share);
    ShareOwner owner(share);
    return found < 0 ? nullptr : std::move(owner);
}

std::string LastError() {
    return KAPICErrText(KAPICErrGet());
}

ExitCode CheckShare(const std::string& name) {
    const std::string shown = programs::Printable(name);
    const ShareOwner share = GetShare(name);
    if (!share || share->path == nullptr) {
        return Fail(kLocal, "share '%s': %s (see 'zelctl share list')", shown.c_str(),
                    LastError().c_str());
    }
    if (access(share->path, R_OK | X_OK) != 0) {
        return Fail(kLocal, "share '%s': its folder %s cannot be read: %s", shown.c_str(),
                    share->path, strerror(errno));
    }
    bool fit = false;
    if (ZEL::IsValidShare(name, fit) != 0) {
        return Fail(kLocal, "share '%s': %s", shown.c_str(), LastError().c_str());
    }
    if (!fit) {
        return Fail(
            kLocal,
            "share '%s' lies on a removable or network disk: only shares on this machine's own "
            "disks are pushed",
            shown.c_str());
    }
    return kOk;
}

}  // namespace

ExitCode AddShare(const std::string& name, const std::string& path, bool acl, bool windows) {
    const ExitCode prepared = PrepareHost();
    if (prepared != kOk) {
        return prepared;
    }
    std::error_code error;
    const std::string absolute = std::filesystem::absolute(path, error).lexically_normal();
    unsigned int flags = 0;
    if (acl) {
        flags |= TARQ_SHARE_ACL;
    }
    if (windows) {
        flags |= TARQ_SHARE_WINDOWS;
    }
    if (TARQShareAdd(name.c_str(), absolute.c_str(), flags) < 0) {
        if (KAPICErrGet() == TARQ_ERR_BAD_PARAMETER) {
            return Fail(
                kLocal,
                "'%s' at %s cannot be a share: a name has 1 to 80 bytes, none of / : \" or a "
                "control "
                "character, and begins with neither a dot, an @ nor a blank; the folder is not /",
                programs::Printable(name).c_str(), programs::Printable(absolute).c_str());
        }
        return Fail(kLocal, "cannot add '%s' at %s: %s", programs::Printable(name).c_str(),
                    programs::Printable(absolute).c_str(), LastError().c_str());
    }
    printf("Share '%s' is %s\n", name.c_str(), absolute.c_str());
    return kOk;
}

ExitCode RemoveShare(const std::string& name) {
    if (TARQShareRemove(name.c_str()) < 0) {
        return Fail(kLocal, "cannot remove '%s': %s", programs::Printable(name).c_str(),
                    LastError().c_str());
    }
    printf("Share '%s' is no longer in the catalogue; its files and its copy stay.\n",
           name.c_str());
    return kOk;
}

std::optional<std::vector<std::string>> ShareNames() {
    const TARQ::ListOwner list(KAPICSzListAlloc(64));
    if (!list || TARQShareEnum(list.get()) < 0) {
        Fail(kLocal, "cannot read the share catalogue: %s", LastError().c_str());
        return std::nullopt;
    }
    std::vector<std::string> names;
    for (int i = 0; i < KAPICSzListCount(list.get()); ++i) {
        names.emplace_back(KAPICSzListGet(list.get(), i));
    }
    return names;
}

ExitCode ListShares(bool as_json) {
    const auto names = ShareNames();
    if (!names) {
        return kLocal;
    }
    programs::Table table({"SHARE", "STATE", "FOLDER"});
    for (const std::string& name : *names) {
        const ShareOwner share = GetShare(name);
        table.Add({name, share ? "ready" : LastError(),
                   share && share->path != nullptr ? share->path : ""});
    }
    table.Print(as_json);
    return kOk;
}

ExitCode CheckShares(const std::vector<std::string>& names) {
    for (const std::string& name : names) {
        const ExitCode checked = CheckShare(name);
        if (checked != kOk) {
            return checked;
        }
    }
    return kOk;
}

}  // namespace zelctl

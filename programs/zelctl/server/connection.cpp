#include "programs/zelctl/server/connection.h"

#include <vector>

#include "programs/common/bandwidth.h"
#include "programs/common/failure.h"
#include "programs/common/task_fields.h"
#include "programs/common/terminal.h"
#include "programs/zelctl/base/setting_option.h"

namespace zelctl {

namespace {

constexpr const char* kSettings[] = {"server_name",   "user",     "ssh",  "ssh_port",
                                     "rsync_timeout", "compress", "block"};

}  // namespace

void ConnectionOptions::AddTo(CLI::App* command,
                              std::initializer_list<const char*> other_settings) {
    said.asMap();
    std::vector<const char*> keys(std::begin(kSettings), std::end(kSettings));
    keys.insert(keys.end(), other_settings);
    for (const char* key : keys) {
        AddSetting(*command, *programs::FindTaskField(key), said, true);
    }
    AddTrustOptions(*command, trust);
    command->add_option(
        "--password-file", password_file,
        "File with the account's password ('-': standard input); else it is asked for");
}

ZEL::SyncInfo ConnectionOptions::ToSyncInfo() const {
    ZEL::PObject settings(programs::DefaultSettings());
    for (const auto& [key, value] : said.asMap()) {
        const programs::TaskField& field = *programs::FindTaskField(key);
        const std::string fault = FaultOf(field, value);
        if (!fault.empty()) {
            throw programs::Failure(programs::FailureKind::kUsage, NameOf(field) + " " + fault);
        }
        settings[key] = value;
    }
    const std::string server = programs::ServerOf(settings);
    MeetServer(server, WishOf(said, trust));
    settings["pswd"] = programs::ReadPassword(
        password_file, "Password of " + settings["user"].asString() + " on " + server + ": ");
    ZEL::SyncInfo info;
    ZEL::PObj2SyncInfo(settings, info);
    info.SetMaxBandwidth(
        programs::Bandwidth::Of(info.GetMaxBandwidth(), settings["bandwidth_windows"].asString())
            .Now());
    if (!info.Validate()) {
        throw programs::Failure(programs::FailureKind::kUsage,
                                "the server or the account is not given");
    }
    return info;
}

TrustWish WishOf(const ZEL::PObject& said, TrustWish trust) {
    if (said.hasMember("ssh")) {
        trust.ssh = said["ssh"].asBool();
    }
    if (said.hasMember("ssh_port") && trust.ssh.value_or(false)) {
        trust.port = static_cast<int>(said["ssh_port"].asUInt32());
    }
    return trust;
}

}  // namespace zelctl

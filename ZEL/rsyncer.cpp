#include "ZEL/rsyncer.h"

#include <fstream>
#include <utility>
#include <vector>

#include "ZEL/log.h"
#include "tarq/owners.h"

// Log messages contain a line number of this file, except for two with fixed numbers.
#define LOG_ERROR_AT(line, text, ...) \
    Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] ZEL/rsyncer(%d): " text "\n", line, ##__VA_ARGS__)
#define LOG_ERROR(text, ...) LOG_ERROR_AT(__LINE__, text, ##__VA_ARGS__)
#define LOG_INFO(text, ...)                                                            \
    Logger::LogMsg(Logger::LEVEL_INFO, "[INFO] ZEL/rsyncer(%d): " text "\n", __LINE__, \
                   ##__VA_ARGS__)

namespace ZEL {

namespace {

using Lines = std::list<std::string>;
using Params = std::list<std::pair<std::string, std::string>>;

// Statuses of the wrapper and of the server that the driver distinguishes.
constexpr int kDone = 0;
constexpr int kLookupFailed = 42;
constexpr int kUnknownCommand = 43;
constexpr int kUnsupportedCommand = 51;
constexpr int kShortFormWanted = 202;
constexpr int kAccepted = 207;
constexpr int kPassedThrough = 208;
constexpr int kNoCandidate = 213;
constexpr int kConflicts = 214;
constexpr int kKeyFileFailed = 300;

// The server is told this host's name without its first 35 characters when it is longer than that.
constexpr unsigned int kHostNameSkip = 35;
constexpr int kKeyPathSize = 4096;
// On the server: not below this machine's root folder.
constexpr char kServerKeyFolder[] = "/usr/tarq/etc/.encrypt";

constexpr int kVersionFileLine = 29;
constexpr int kConflictFileLine = 48;

const char* YesNo(bool value) {
    return value ? "yes" : "no";
}
const char* OneZero(bool value) {
    return value ? "1" : "0";
}

std::string Join(const std::list<std::string>& items, const char* separator) {
    std::string joined;
    for (const std::string& item : items) {
        if (&item != &items.front()) {
            joined += separator;
        }
        joined += item;
    }
    return joined;
}

// Where a command's answer arrives; removed with this object.
class AnswerFile {
public:
    AnswerFile() : path_(GetTempFile()) {}
    ~AnswerFile() { PutTempFile(path_); }
    AnswerFile(const AnswerFile&) = delete;
    AnswerFile& operator=(const AnswerFile&) = delete;

    const std::string& Path() const { return path_; }  // empty: none could be made

private:
    std::string path_;
};

std::string Line(const std::string& key, const std::string& value) {
    return key + "=\"" + value + "\"";
}

int GenCmdLines(const std::string& command, const Params& params, Lines& lines) {
    const std::string client_id = GetClientID();
    if (client_id.empty()) {
        LOG_ERROR("Fail to get client id");
        return -1;
    }
    lines.push_back(Line("command", command));
    lines.push_back(Line("clientID", client_id));
    for (const auto& param : params) {
        lines.push_back(Line(param.first, param.second));
    }
    return 0;
}

int ReadServerVersion(const std::string& path) {
    int version = -1;
    std::ifstream file(path);
    if (!file) {
        LOG_ERROR_AT(kVersionFileLine, "Fail to open server version file");
        return version;
    }
    file >> version;
    return version;
}

int ReadConflictShares(const std::string& path, std::list<std::string>& conflicts) {
    std::ifstream file(path);
    if (!file) {
        LOG_ERROR_AT(kConflictFileLine, "Fail to open conflict share file");
        return -1;
    }
    std::string line;
    if (std::getline(file, line) && !line.empty()) {
        SplitStringByChars(line, ":", conflicts);
    }
    return 0;
}

}  // namespace

// ---- RsyncTask ----

Rsyncer::RsyncTask::RsyncTask() {
    setDelete(true);
    setNumericIds(true);
    setTarqAuth(true, true);
    setTarqPseudoRoot(true);
}

void Rsyncer::RsyncTask::SetSSH(bool enable) {
    setSsh(enable);
}
void Rsyncer::RsyncTask::SetServerPort(unsigned int port) {
    setPort(static_cast<int>(port));
}
void Rsyncer::RsyncTask::SetCompression(bool enable) {
    setCompress(enable);
}
void Rsyncer::RsyncTask::SetBlockLevelSync(bool enable) {
    setDeltaCopy(enable);
}
void Rsyncer::RsyncTask::SetListOnly(bool enable) {
    setListOnly(enable);
}
void Rsyncer::RsyncTask::SetRelativePath(bool enable) {
    setRelativePath(enable);
}
void Rsyncer::RsyncTask::SetSyncACL(bool enable) {
    setTarqAcl(enable);
}
void Rsyncer::RsyncTask::SetTestTask(bool is_test) {
    setDebugLog(!is_test);
}
void Rsyncer::RsyncTask::SetRsyncTimeout(unsigned int seconds) {
    setTimeout(static_cast<int>(seconds));
}
void Rsyncer::RsyncTask::SetUser(const std::string& user_name) {
    user = user_name;
}
void Rsyncer::RsyncTask::SetServerIP(const std::string& server_address) {
    serverIP = server_address;
}
void Rsyncer::RsyncTask::SetPassword(const std::string& secret) {
    password = secret;
}
void Rsyncer::RsyncTask::SetCanceller(std::function<bool()> cancelled) {
    canceller = std::move(cancelled);
}

int Rsyncer::RsyncTask::Run(CancelChecker cancel) {
    return execute(cancel != nullptr ? cancel : canceller);
}

int Rsyncer::RsyncTask::ExecuteCmd(const Lines& lines, CancelChecker cancel) {
    setTarqCustCmdRule(lines);
    setDestPath(user, serverIP, password, "", "");
    const int status = Run(cancel);
    return Finish(status, status == kDone || status == kAccepted || status == kPassedThrough);
}

int Rsyncer::RsyncTask::Execute(const std::string& src_path, const std::string& module_name,
                                CancelChecker cancel, const std::string& dest_sub_path,
                                const std::list<std::string>& exclude_rules) {
    setExcludeRule(exclude_rules);
    setSrcPath(src_path);
    setDestPath(user, serverIP, password, module_name, dest_sub_path);
    const int status = Run(cancel);
    return Finish(status, status == kDone);
}

int Rsyncer::RsyncTask::Finish(int status, bool is_success) {
    if (!is_success) {
        logError();
    }
    return status;
}

// ---- The object ----

Rsyncer::Rsyncer() : serverVersion(-1), cancelChecker(nullptr) {}

Rsyncer::~Rsyncer() = default;

int Rsyncer::Initialize(const SyncInfo& info) {
    Clear();
    syncInfo = info;
    return TestServer();
}

void Rsyncer::Clear() {}

void Rsyncer::SetCancelChecker(CancelChecker checker) {
    cancelChecker = checker;
}

void Rsyncer::SetTaskSetup(std::function<void(RsyncTask&)> setup) {
    taskSetup = std::move(setup);
}

bool Rsyncer::SupportMultiSource() const {
    return serverVersion > 0;
}

SyncInfo Rsyncer::GetSyncInfo() const {
    return syncInfo;
}

std::string Rsyncer::GetLatestIP() const {
    return syncInfo.GetServerIP();
}

void Rsyncer::InitRsyncTask(RsyncTask& task, bool is_test) const {
    task.SetServerIP(syncInfo.GetServerIP());
    task.SetUser(syncInfo.GetUser());
    task.SetPassword(syncInfo.GetPassword());
    task.SetSSH(syncInfo.UseSSH());
    task.SetTestTask(is_test);
    if (syncInfo.UseSSH()) {
        task.SetServerPort(syncInfo.GetSSHPort());
    }
    task.SetRsyncTimeout(syncInfo.GetRsyncTimeout());
    if (taskSetup) {
        taskSetup(task);
    }
}

// Runs a command whose lines were built with the result `built`. `sender` is named in the log line
// of a failure.
int Rsyncer::SendCommand(const char* sender, int built, const Lines& lines, bool is_test,
                         int& status) const {
    if (built != 0) {
        LOG_ERROR("%s: Fail to write command file", sender);
        return -1;
    }
    RsyncTask task;
    InitRsyncTask(task, is_test);
    status = task.ExecuteCmd(lines, cancelChecker);
    return 0;
}

// ---- Finding the server ----

int Rsyncer::TestProtocol(int& status) const {
    if (DoSinglePairing(true, status) != 0) {
        LOG_ERROR("Fail to test connection");
        return -1;
    }
    if (status == kAccepted) {
        status = kDone;
    }
    if (status != kDone) {
        LOG_ERROR("Fail to test connection [%d]", status);
    }
    return 0;
}

int Rsyncer::GenServerVersionCmd(const std::string& out_file, Lines& lines) const {
    return GenCmdLines("ZEL_GetProtocolVer", {{"outfile", out_file}}, lines);
}

void Rsyncer::GetServerVersion() {
    const AnswerFile answer;
    if (answer.Path().empty()) {
        LOG_ERROR("GetServerVersion: Fail to get output file");
        return;
    }
    Lines lines;
    if (GenServerVersionCmd(answer.Path(), lines) != 0) {
        LOG_ERROR("GetServerVersion: Fail to write command file");
        return;
    }
    RsyncTask task;
    InitRsyncTask(task, true);
    task.SetListOnly(true);
    const int status = task.ExecuteCmd(lines, cancelChecker);
    if (status == kUnknownCommand || status == kUnsupportedCommand) {
        serverVersion = 0;
    } else if (status == kDone) {
        serverVersion = ReadServerVersion(answer.Path());
    } else {
        LOG_ERROR("Fail to get server version [%d]", status);
    }
}

int Rsyncer::TestServer() {
    const std::string configured_ip = syncInfo.GetServerIP();
    int status = kNoCandidate;
    std::vector<std::string> candidates;
    if (GetUsableIP(syncInfo.GetServerName(), configured_ip, candidates) != 0) {
        LOG_ERROR("Fail to lookup ip for %s(%s)", syncInfo.GetServerName().c_str(),
                  configured_ip.c_str());
        return kLookupFailed;
    }
    for (const std::string& candidate : candidates) {
        LOG_INFO("Test %s is reachable", candidate.c_str());
        syncInfo.SetServerIP(candidate);
        if (TestProtocol(status) != 0 || status != kDone) {
            syncInfo.SetServerIP(configured_ip);
            continue;
        }
        // A server that answers but sends no version stays selected while the next address is
        // tried.
        GetServerVersion();
        if (serverVersion >= 0) {
            LOG_INFO("Get server version [%d]", serverVersion);
            break;
        }
    }
    if (serverVersion >= 0) {
        return 0;
    }
    LOG_ERROR("Fail to find rsync reachable ip for %s(%s)", syncInfo.GetServerName().c_str(),
              syncInfo.GetServerIP().c_str());
    return status;
}

// ---- Pairing ----

int Rsyncer::DoPairing(bool dry_run, const std::list<std::string>& shares,
                       std::list<std::string>& conflicts, int& status) const {
    if (!SupportMultiSource()) {
        conflicts.clear();
        return DoSinglePairing(dry_run, status);
    }
    bool require_encryption = false;
    for (const std::string& share : shares) {
        ShareInfo info;
        if (ZEL::GetShareInfo(share, info) != 0) {
            LOG_ERROR("Fail to get share info of '%s'", share.c_str());
            return -1;
        }
        // One is enough: the remaining shares are not looked up.
        if (info.IsEncrypted()) {
            require_encryption = true;
            break;
        }
    }
    return DoMultiPairing(dry_run, require_encryption, shares, conflicts, status);
}

int Rsyncer::DoSinglePairing(bool dry_run, int& status) const {
    Lines lines;
    return SendCommand("SinglePairing", GenSinglePairCmd(dry_run, lines), lines, dry_run, status);
}

int Rsyncer::GenSinglePairCmd(bool dry_run, Lines& lines) const {
    return GenCmdLines("ZEL_Pairing",
                       {{"dryRun", YesNo(dry_run)}, {"serverName", GetHostName(kHostNameSkip)}},
                       lines);
}

int Rsyncer::DoMultiPairing(bool dry_run, bool require_encryption,
                            const std::list<std::string>& shares, std::list<std::string>& conflicts,
                            int& status) const {
    if (shares.empty()) {
        LOG_ERROR("MultiPairing: Share list is empty");
        return -1;
    }
    const AnswerFile answer;
    if (answer.Path().empty()) {
        LOG_ERROR("MultiPairing: Fail to get output file");
        return -1;
    }
    Lines lines;
    const int built = GenPairMultiSrcCmd(dry_run, require_encryption, shares, answer.Path(), lines);
    if (SendCommand("MultiPairing", built, lines, dry_run, status) != 0) {
        return -1;
    }
    if (status != kDone && status != kConflicts) {
        LOG_ERROR("Fail to check share pairing [%d]", status);
        return -1;
    }
    if (ReadConflictShares(answer.Path(), conflicts) != 0) {
        LOG_ERROR("Fail to parse out conflict shares");
        return -1;
    }
    return 0;
}

int Rsyncer::GenPairMultiSrcCmd(bool dry_run, bool require_encryption,
                                const std::list<std::string>& shares, const std::string& out_file,
                                Lines& lines) const {
    if (shares.empty()) {
        LOG_ERROR("GenPairMultiSrcCmd: Empty parameter");
        return -1;
    }
    return GenCmdLines("ZEL_PairingMultiSrc",
                       {{"serverName", GetHostName(kHostNameSkip)},
                        {"syncShares", Join(shares, ":")},
                        {"dryRun", YesNo(dry_run)},
                        {"outfile", out_file},
                        {"requireEncryptionShareSupport", YesNo(require_encryption)}},
                       lines);
}

int Rsyncer::SyncEncryptKey(const std::string& share_name) const {
    TARQShare record = nullptr;
    const int found = TARQShareGet(share_name.c_str(), &record);
    const TARQ::ShareOwner share(record);
    if (found < 0) {
        LOG_ERROR("Fail to get share '%s', errno=[%d]", share_name.c_str(), KAPICErrGet());
        return kKeyFileFailed;
    }
    int is_encrypted = 0;
    int auto_decrypt = 0;
    // Each question is asked only when the one before it was answered.
    const bool answered =
        KAPIShareIsEncryptionGet(share.get(), &is_encrypted) >= 0 &&
        (is_encrypted == 0 || KAPIShareIsAutoDecryptGet(share.get(), &auto_decrypt) >= 0);
    if (!answered) {
        LOG_ERROR("Fail to get status of encryption of share '%s', errno=[%d]", share_name.c_str(),
                  KAPICErrGet());
        return kKeyFileFailed;
    }
    if (is_encrypted == 0) {
        return 0;
    }
    char key_path[kKeyPathSize] = "";
    if (auto_decrypt != 0) {
        if (TARQShareEncAutoKeyFileGet(share.get(), key_path, kKeyPathSize) < 0) {
            LOG_ERROR("SyncEncryptKey: Fail to get auto key file path for share '%s', errno=[%d]",
                      share_name.c_str(), KAPICErrGet());
            return kKeyFileFailed;
        }
    } else if (TARQShareEncKeyFileGet(share.get(), key_path, kKeyPathSize) < 0) {
        LOG_ERROR("SyncEncryptKey: Fail to get key file path for share '%s', errno=[%d]",
                  share_name.c_str(), KAPICErrGet());
        return kKeyFileFailed;
    }
    if (KAPICFileExist(key_path) == 0) {
        return 0;
    }
    RsyncTask task;
    InitRsyncTask(task, false);
    task.SetCompression(syncInfo.UseCompression());
    task.SetBlockLevelSync(syncInfo.UseBlockLevelSync());
    // An encryption key is never sent in the clear, whatever the task says.
    task.SetSSH(true);
    task.SetServerPort(syncInfo.GetSSHPort());
    return task.Execute(key_path, kServerKeyFolder, cancelChecker, share_name, {});
}

// ---- A sync run ----

int Rsyncer::GetShareInfo(const std::string& share_name, ShareInfo& info) {
    const auto cached = shareInfoCache.find(share_name);
    if (cached != shareInfoCache.end()) {
        info = cached->second;
        return 0;
    }
    const int result = ZEL::GetShareInfo(share_name, info);
    if (result == 0) {
        shareInfoCache[share_name] = info;
    }
    return result;
}

int Rsyncer::GenStartSyncShareCmd(const std::string& share_name, bool with_acl, Lines& lines) {
    if (share_name.empty()) {
        LOG_ERROR("GenStartSyncShareCmd: Empty parameter");
        return -1;
    }
    ShareInfo info;
    if (GetShareInfo(share_name, info) != 0) {
        LOG_ERROR("Fail to get share info of '%s'", share_name.c_str());
        return -1;
    }
    VolumeInfo volume;
    if (GetVolumeInfo(share_name, volume) != 0) {
        LOG_ERROR("Fail to get volume info");
        return -1;
    }
    Params params = {{"volumeName", volume.GetName()}, {"shareName", info.GetName()}};
    if (with_acl) {
        params.insert(params.end(), {{"isEncrypt", OneZero(info.IsEncrypted())},
                                     {"isAutomount", OneZero(info.IsAutoMount())},
                                     {"isEnableACL", OneZero(info.IsACL())},
                                     {"isWinShare", OneZero(info.IsWinShare())},
                                     {"lenEncKey", std::to_string(info.GetEncryptKeyLen())},
                                     {"connAccount", syncInfo.GetUser()}});
    }
    return GenCmdLines("ZEL_SyncStart", params, lines);
}

int Rsyncer::StartSyncShare(const std::string& share_name, bool with_acl, int& status) {
    Lines lines;
    const int built = GenStartSyncShareCmd(share_name, with_acl, lines);
    return SendCommand("StartSyncShare", built, lines, false, status);
}

int Rsyncer::StartSyncShare(const std::string& share_name, int& status) {
    if (StartSyncShare(share_name, true, status) != 0) {
        LOG_ERROR("Fail to start sync share '%s' with ACL", share_name.c_str());
        return -1;
    }
    if (status != kShortFormWanted) {
        return 0;
    }
    if (StartSyncShare(share_name, false, status) != 0) {
        LOG_ERROR("Fail to start sync share '%s'", share_name.c_str());
        return -1;
    }
    return 0;
}

int Rsyncer::RunSync(uint64_t /*task_id*/, const std::string& share_name, const std::string& path,
                     const std::list<std::string>& exclude_rules, int& status) {
    ShareInfo info;
    if (GetShareInfo(share_name, info) != 0) {
        LOG_ERROR("Fail to get share info of '%s'", share_name.c_str());
        return -1;
    }
    RsyncTask task;
    InitRsyncTask(task, false);
    task.SetCompression(syncInfo.UseCompression());
    task.SetBlockLevelSync(syncInfo.UseBlockLevelSync());
    task.SetSyncACL(true);
    std::string source = info.GetModulePath() + "/";
    if (path != "/") {
        // rsync uses the part after "/./" as the path at the server.
        source += "." + path;
        task.SetRelativePath(true);
    }
    if (!IsPathExist(source)) {
        status = kDone;
        return 0;
    }
    status = task.Execute(source, info.GetModuleName(), cancelChecker, "", exclude_rules);
    return 0;
}

int Rsyncer::GenSendBeaconCmd(const std::string& task_name, Lines& lines) const {
    if (task_name.empty()) {
        LOG_ERROR("GenSendBeaconCmd: Empty parameter");
        return -1;
    }
    return GenCmdLines("ZEL_UpdateTaskStatus", {{"taskName", task_name}}, lines);
}

int Rsyncer::SendBeacon(const std::string& task_name, int& status) const {
    Lines lines;
    return SendCommand("SendBeacon", GenSendBeaconCmd(task_name, lines), lines, false, status);
}

int Rsyncer::GenFinishSyncCmd(const std::string& finish_type, const std::string& name,
                              Lines& lines) const {
    if (finish_type.empty() || name.empty()) {
        LOG_ERROR("GenFinishSyncCmd: Empty parameter");
        return -1;
    }
    return GenCmdLines("ZEL_SyncFinish", {{"finishType", finish_type}, {"name", name}}, lines);
}

int Rsyncer::FinishSync(const std::string& finish_type, const std::string& name,
                        int& status) const {
    Lines lines;
    return SendCommand("FinishSync", GenFinishSyncCmd(finish_type, name, lines), lines, false,
                       status);
}

template void SplitStringByChars(const std::string&, const std::string&, std::list<std::string>&);

}  // namespace ZEL

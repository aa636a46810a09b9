#include "programs/zelctl/declare.h"
#include "programs/zelctl/share/commands.h"
#include "programs/zelctl/share/samba.h"

namespace zelctl {

namespace {

void DeclareShareImport(CLI::App& share) {
    static std::string config;
    static std::vector<std::string> names;
    static bool samba = false;
    static bool dry_run = false;
    CLI::App* const import = share.add_subcommand("import", "Add the shares of another service");
    import->add_flag("--samba", samba, "Of Samba, as 'testparm' tells them")->required();
    import->add_option("--config", config, "Its configuration file")
        ->option_text("FILE")
        ->default_str("the system's");
    import->add_flag("-n,--dry-run", dry_run, "Only say what would be done");
    import->add_option("names", names, "Only these");
    import->footer("Shares that are in the catalogue already stay as they are.");
    import->callback([] { ImportSambaShares(config, names, dry_run);
});
}  // namespace

}  // namespace zelctl

void DeclareShare(CLI::App& share) {
    share.require_subcommand(1);
    static std::string name;
    static std::string path;
    static bool acl = false;
    static bool windows = false;
    static bool as_json = false;
    static bool force = false;

    CLI::App* const add = share.add_subcommand("add", "Add a folder as a share");
    add->add_option("name", name, "The share's name")->required();
    add->add_option("folder", path, "The folder")->required();
    add->add_flag("--acl", acl, "Its files carry access control lists");
    add->add_flag("--windows", windows, "It is shared with Windows clients");
    add->callback([] { AddShare(name, path, acl, windows); });

    static bool yes = false;
    CLI::App* const confirm = share.add_subcommand(
        "confirm", "Say that the folder that is there now is the share's, after it was replaced");
    confirm->add_option("name", name, "The share's name")->required();
    confirm->add_flag("-y,--yes", yes, "Do not ask");
    confirm->callback([] { ConfirmShare(name, yes); });

    CLI::App* const list = share.add_subcommand("list", "List the shares");
    list->add_flag("--json", as_json, "Write JSON, for programs");
    list->callback([] { ListShares(as_json); });

    CLI::App* const remove =
        share.add_subcommand("rm", "Take a share out of the catalogue; its files stay");
    remove->add_option("name", name, "The share's name")->required();
    remove->add_flag("--force", force, "Even when tasks send it");
    remove->callback([] { RemoveShare(name, force); });

    DeclareShareImport(share);
}

}  // namespace zelctl

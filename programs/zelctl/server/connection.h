// The options for reaching a server, shared by several commands.
#pragma once

#include <initializer_list>
#include <string>

#include "ZEL/pobject.h"
#include "ZEL/sync_obj.h"
#include "programs/zelctl/server/trust.h"

namespace zelctl {

struct ConnectionOptions {
    ZEL::PObject said;  ///< the task settings that were given, by key
    TrustWish trust;
    std::string password_file;

    /// Declares these options, and those of the other settings given.
    void AddTo(CLI::App* command, std::initializer_list<const char*> other_settings = {});

    /// Makes sure that the server is trusted, and asks for the password if necessary.
    ZEL::SyncInfo ToSyncInfo() const;
};

/// The part of the given settings that concerns how the server is reached.
TrustWish WishOf(const ZEL::PObject& said, TrustWish trust);

}  // namespace zelctl

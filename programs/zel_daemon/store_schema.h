// The layout of the store's file, and how an older one becomes the one of today.
#pragma once

#include <string>
#include <vector>

#include "programs/zel_daemon/sqlite.h"

namespace zel_daemon {

/// Each step brings the layout from the version that is its index to the next one. A step that has
/// been released never changes: what is new comes as a further step.
using SchemaSteps = std::vector<std::string>;

/// The steps of the store.
const SchemaSteps& StoreSchema();

/// Whether nobody has put anything into the database yet.
bool IsBlank(Database& database);

/// Takes the steps that the file lacks, each in a transaction of its own. Throws Failure (kLocal),
/// before anything has changed, for a database that is no store and for a store that has more steps
/// behind it than there are.
void BringUpToDate(Database& database, const SchemaSteps& steps);

}  // namespace zel_daemon

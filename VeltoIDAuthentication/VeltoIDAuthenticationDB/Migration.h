// What earlier agents stored otherwise than this one does is put right when the database is loaded.
#pragma once

#include "Values/Value.h"

namespace veltoid::database {

struct MigrationOutcome {
    /// The sections have to be written.
    bool sectionsChanged = false;
    /// The versions have to be written, before anything else.
    bool versionsCut = false;
};

/// Changes accounts and meta information as the accessor versions in `versions` require, latest first. An
/// agent so old that its data was rewritten by all later ones cuts the list after itself.
MigrationOutcome migrate(Dictionary& accounts, Dictionary& metaInfo, Array& versions);

}  // namespace veltoid::database

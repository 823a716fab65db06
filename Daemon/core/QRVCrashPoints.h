// Named points at which an internal build can be made to stop dead, as a
// power loss would: `_exit`, no clean-up, nothing flushed. The crash tests
// start the daemon with QUORVAD_CRASH_AT=<name> and check that the next
// start finds the disk consistent. On any other build the points do nothing.
//
// Points: create.staged, create.metadata-written, create.live;
// replace.journal-written, replace.old-parked, replace.new-placed,
// replace.cache-updated, replace.staging-removed; deathrow.item-removed;
// dataprotection.update-written, dataprotection.first-item-changed,
// dataprotection.before-delete; boot.uuid-rolled, boot.restore-child-moved;
// migration.log-moved, migration.bundles-relocated,
// migration.acl-standardized, migration.bundle-owned,
// migration.user-subdirectories-made.
#pragma once

#include "core/QRVServices.h"

void QRVCrashPoint(QRVServices& services, const char* name);

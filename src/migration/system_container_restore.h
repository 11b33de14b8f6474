// Restoring system containers from a device backup. A restore puts the saved
// content of system containers (class 12) and system group containers (class
// 13) into the mobile user's "Library/Backup/SystemContainers", under "Data"
// and "Shared", one directory per container named by its identifier. At the
// first start after the next boot that content is moved into the live
// containers (made when missing), and the backup is removed.
//
// Each backup directory is first renamed to "<name>.inprogress", so that a
// crash half-way does not install it a second time at the next boot. What
// cannot be placed goes to "<name>.inprogress.failed/<identifier>/". On an
// internal build the backup directory stays afterwards, for inspection.
#pragma once

#include <string>

#include "store/container_class.h"
#include "store/file_url.h"

namespace kestrel {

class KSTClientConnection;

// Runs on the main thread before any request is served; failures are logged
// and never stop the start.
void KSTMoveSystemContainersIntoPlace(KSTClientConnection& clientConnection);

// One restored directory into the live container of its identifier and class.
void _moveSystemContainerIntoPlace(const KSTFileURL& restoredDirectory,
                                   KSTContainerClass containerClass,
                                   KSTClientConnection& clientConnection);
// Puts an item that could not be placed into failedDirectory under itemName.
void _moveFailedPathAside(const KSTFileURL& item, const KSTFileURL& failedDirectory,
                          const std::string& itemName);

}  // namespace kestrel

// Start-up and boot-time housekeeping of the container store. Start-up calls
// these on the shared client connection, on the main thread, before the
// listener opens. The work they do grows with the store: journal recovery,
// staging clean-up, transient and orphan clean-up, and the death-row sweep.
#include "daemon/client_connection.h"
#include "daemon/log.h"

namespace kestrel {

void KSTClientConnection::rebootContainerManagerSetup() {
  KSTLog(kLogDebug, "boot-time setup: no migrations or restores to run");
}

void KSTClientConnection::containerManagerSetup() {
  KSTLog(kLogDebug, "start-up setup: no interrupted operations to recover");
}

void KSTClientConnection::rebootContainerManagerCleanup() {
  KSTLog(kLogDebug, "boot-time cleanup: no transient or orphaned containers to retire");
}

void KSTClientConnection::containerManagerCleanup() {
  KSTLog(kLogDebug, "start-up cleanup: nothing staged to retire");
}

}  // namespace kestrel

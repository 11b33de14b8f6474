// The command handlers: each decodes its request keys, makes one call of an
// operation and encodes the reply keys. They live beside their operations.
#pragma once

#include "daemon/request_dispatch.h"

namespace kestrel {

// Whether this build of the daemon serves the row's command.
bool KSTCommandIsAvailable(const KSTCommandRow& row);

// 25: the retry test, on internal builds only.
void KSTHandleRetryTest(KSTCommandContext& context);

}  // namespace kestrel

#pragma once

#include "host/JsonRpcMessage.h"
#include "platform/foundation/KsError.h"

namespace cindral {

/// An error read back from what answerWithError() wrote, the item in the way included.
KsError errorFromJson(const Json& json);
/// What can't be an answer of a daemon.
KsError unreadableAnswer();

}  // namespace cindral

#pragma once

#include <optional>

#include "platform/value/PlistValue.h"

namespace larder {

// An answer before it goes on the wire: a status, a property list, and the
// key to sign it with when the request was signed.
struct StoreReply {
  int status = 200;
  PlistValue body;
  std::optional<PlistData> signingKey;
};

}  // namespace larder

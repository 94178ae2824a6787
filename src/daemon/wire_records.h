// The wire records of the client protocol turned into the daemon's values and back.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "core/requests.h"

namespace tavix {

class TVXBag;

namespace proto {
class TVXBagData;
class TVXError;
class TVXReply;
class TVXRequest;
}  // namespace proto

// The request of the wire record's kind, or none for a record without a kind.
std::shared_ptr<TVXRequest> requestFromWire(const proto::TVXRequest& wire);

// The body is moved into the wire record: a search reply's body is its largest part.
void replyToWire(TVXReply&& reply, proto::TVXReply* wire);
void errorToWire(const TVXError& error, proto::TVXError* wire);
void bagToWire(const TVXBag& bag, proto::TVXBagData* wire);

}  // namespace tavix

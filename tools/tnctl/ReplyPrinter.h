#pragma once

// How tnctl shows a reply from tenond on stdout.
//
// Readable (the default), key by key in the reply's order:
//   matches     one line per plug-in form: identifier, version and UUID
//               (those present), or the form itself when it has none of
//               them, then the user's election ("election 1", or
//               "no election" when the form's annotation has none)
//   extensions  one sandbox extension token per line
//   uuids       the hold token
//   anything else  "key: value"
// `errorcode` and `error` are left to the error line on stderr; a success
// that carries nothing prints `emptySuccess` ("ok" unless the command says
// more).
//
// JSON (--json): the whole reply as one JSON document, with `matches`
// decoded from its typed encoding so that programs see the forms.

#include <string>

#include "libtenon/client/TNDaemonClient.h"
#include "platform/value/Value.h"

namespace tnctl {

void printReply(const tn::TNDaemonClient& client, const tn::Value& reply, bool json, bool succeeded,
                const std::string& emptySuccess = "ok");

}  // namespace tnctl

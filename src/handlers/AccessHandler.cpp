// The "access" request: one read-only sandbox-extension token per plug-in named, in the request's order, each
// granting read access to the plug-in's whole bundle. It needs only that the UUIDs resolve and the tokens can be
// issued: neither the host policy nor holds are asked, since reading a bundle uses nothing of the plug-in.

#include <cerrno>
#include <string>

#include "bexil/Protocol.h"
#include "daemon/Transaction.h"
#include "policy/BXDPlugIn.h"
#include "policy/BXIssueReadExtension.h"

namespace bexil {

void Transaction::accessPlugIns() {
    MutableArray tokens;
    bool walked = processUuidList([&](const std::shared_ptr<BXDPlugIn>& plugIn) {
        std::optional<std::string> url = plugIn->url();
        std::optional<std::string> token = url ? BXIssueReadExtension(*url) : std::nullopt;
        if (!token) {
            int error = url ? errno : ENOENT;
            fail(ErrorCode::OperationFailed,
                 formatPrintf("cannot create extension to %@: %d", plugIn->path().value_or(""), error));
            return false;
        }
        tokens.append(Value::string(std::move(*token)));
        return true;
    });
    if (!walked) return;
    reply().set(protocol::key::kExtensions, tokens.take());
    done();
}

}  // namespace bexil

// A daemon record of a well-formed plug-in, for the daemon layer's tests.
#pragma once

#include <memory>
#include <string>

#include "platform/ledgerix/LXBexilProxy.h"
#include "policy/BXDPlugIn.h"

namespace bexil::test {

// A data plug-in on the system volume, which passes the record's checks without a container or an application;
// its bundle and plug-in identifiers are both `identifier`.
inline std::shared_ptr<BXDPlugIn> plugInRecord(const std::string& identifier, const Uuid& uuid) {
    LXBexilProxy::Fields fields;
    fields.bundleURL = "/System/Library/PlugIns/" + identifier + ".bxplugin";
    fields.isOnSystemPartition = true;
    fields.pluginIdentifier = identifier;
    fields.bundleIdentifier = identifier;
    fields.pluginUUID = uuid;
    fields.infoVrec = Value::dictionary(
        {{"BDBundleIdentifier", Value::string(identifier)},
         {"RZExtension", Value::dictionary({
                             {"RZExtensionProtocol", Value::string("#Data")},
                             {"RZExtensionAttributes", Value::dictionary({{"RZExtensionVersion", Value::string("1")}})},
                         })}});
    return BXDPlugIn::initWithLXData(std::make_shared<LXBexilProxy>(std::move(fields)));
}

}  // namespace bexil::test

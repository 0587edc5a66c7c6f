#include "platform/ledgerix/LXApplicationProxy.h"

#include <utility>

#include "platform/ledgerix/LXBexilProxy.h"

namespace bexil {

LXApplicationProxy::LXApplicationProxy(Fields fields, PlugInLoader loader)
    : fields_(std::move(fields)), loader_(std::move(loader)) {}

LXApplicationProxy::LXApplicationProxy(Fields fields, PlugInList plugIns)
    : fields_(std::move(fields)), plugIns_(std::move(plugIns)) {}

const LXApplicationProxy::PlugInList& LXApplicationProxy::plugIns() const {
    std::call_once(loaded_, [this] {
        if (loader_) {
            plugIns_ = loader_();
            // The loader may hold the registry alive; it is not needed any more.
            loader_ = nullptr;
        }
    });
    return plugIns_;
}

std::string LXApplicationProxy::description() const {
    std::string text = "<application ";
    text += fields_.bundleIdentifier.value_or("(no identifier)");
    text += ' ';
    text += fields_.bundleURL;
    if (fields_.isPlaceholder) text += " placeholder";
    text += '>';
    return text;
}

}  // namespace bexil

#include "platform/ledgerix/LXApplicationProxy.h"

#include <utility>

#include "platform/ledgerix/LXBexilProxy.h"

namespace bexil {

LXApplicationProxy::LXApplicationProxy(Fields fields, PlugInLoader loader)
    : fields_(std::move(fields)), loader_(std::move(loader)) {}

LXApplicationProxy::LXApplicationProxy(Fields fields, PlugInList plugins)
    : fields_(std::move(fields)), plugins_(std::move(plugins)) {}

const LXApplicationProxy::PlugInList& LXApplicationProxy::plugins() const {
    std::call_once(loaded_, [this] {
        if (loader_) {
            plugins_ = loader_();
            // The loader may hold the registry alive; it is not needed any more.
            loader_ = nullptr;
        }
    });
    return plugins_;
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

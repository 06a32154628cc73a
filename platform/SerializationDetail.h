// Internal: SAX builder that refuses trees nested deeper than a limit. Both the JSON text reader
// and the wire decoder build through it, so no reader of outside input recurses without bound.
#pragma once

#include <nlohmann/json.hpp>

#include "platform/Serialization.h"

namespace tidelink::platform::detail {

class DepthLimitedSax : public nlohmann::detail::json_sax_dom_parser<Value> {
public:
    using Base = nlohmann::detail::json_sax_dom_parser<Value>;
    DepthLimitedSax(Value& out, size_t maxDepth) : Base(out, true), mMaxDepth(maxDepth) {}

    bool start_object(std::size_t len) {
        if (++mDepth > mMaxDepth) TooDeep();
        return Base::start_object(len);
    }
    bool end_object() {
        --mDepth;
        return Base::end_object();
    }
    bool start_array(std::size_t len) {
        if (++mDepth > mMaxDepth) TooDeep();
        return Base::start_array(len);
    }
    bool end_array() {
        --mDepth;
        return Base::end_array();
    }

private:
    [[noreturn]] static void TooDeep() {
        throw nlohmann::json::out_of_range::create(408, "value nested too deeply",
                                                   static_cast<const Value*>(nullptr));
    }
    size_t mMaxDepth;
    size_t mDepth = 0;
};

}  // namespace tidelink::platform::detail

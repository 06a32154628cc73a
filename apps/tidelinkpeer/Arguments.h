// Reading the positional arguments of the messages the reference peer answers. Every reader
// throws BadArguments with a sentence that names the message and what it expects:
// "Bad arguments for RenderVideo (path, source, frame, time, options): argument 3 (the frame) is
// not a GUID".
#pragma once

#include <cstring>
#include <stdexcept>
#include <string>

#include <boost/rational.hpp>

#include "platform/Guid.h"
#include "platform/Serialization.h"
#include "platform/media/MediaTypes.h"
#include "tidelink/core/Brokering.h"

namespace tidelink::peer {

inline constexpr const char* kMessagePrefix = "com.quenlo.tidelink.";

// |name| without the common prefix.
inline std::string ShortName(const std::string& name) {
    return name.rfind(kMessagePrefix, 0) == 0 ? name.substr(std::strlen(kMessagePrefix)) : name;
}

// Arguments that do not fit the message.
class BadArguments : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
};

class Args {
public:
    Args(const platform::Value& args, const std::string& message, const char* signature)
        : mArgs(args), mMessage(ShortName(message)), mSignature(signature) {
        if (!args.is_array() && !args.is_null()) Bad("the arguments are not a list");
    }

    size_t Size() const { return mArgs.is_array() ? mArgs.size() : 0; }

    const platform::Value& At(size_t i) const {
        if (i >= Size()) Bad("argument " + std::to_string(i + 1) + " is missing");
        return mArgs[i];
    }

    std::string Text(size_t i, const char* what) const {
        const platform::Value& v = At(i);
        if (!v.is_string()) Bad("argument " + std::to_string(i + 1) + " (" + what + ") must be a string");
        return v.get<std::string>();
    }

    platform::Guid Id(size_t i, const char* what) const {
        const platform::Value& v = At(i);
        auto id = v.is_string() ? platform::Guid::Parse(std::string_view(v.get_ref<const std::string&>())) : std::nullopt;
        if (!id) Bad("argument " + std::to_string(i + 1) + " (" + what + ") is not a GUID");
        return *id;
    }

    // {"value": numerator, "scale": positive denominator}
    platform::RatioTime Time(size_t i, const char* what) const {
        const platform::Value& v = At(i);
        try {
            return platform::RatioTimeFromValue(v);
        } catch (const nlohmann::json::exception& e) {
            Bad("argument " + std::to_string(i + 1) + " (" + what + ") is not a time {\"value\", \"scale\"}: " + e.what());
        } catch (const boost::bad_rational& e) {
            Bad("argument " + std::to_string(i + 1) + " (" + what + ") is not a time: " + e.what());
        }
    }

    ServerConnection Endpoint(size_t i) const {
        ServerConnection c = Record<ServerConnection>(i, "the endpoint {\"address\", \"port\"}");
        if (c.mAddress.empty() || c.mPort == 0) {
            Bad("argument " + std::to_string(i + 1) + " (the endpoint) needs an address and a port");
        }
        return c;
    }

    template <class T>
    T Record(size_t i, const char* what) const {
        const platform::Value& v = At(i);
        try {
            return v.get<T>();
        } catch (const nlohmann::json::exception& e) {
            Bad("argument " + std::to_string(i + 1) + " (" + what + ") cannot be read: " + e.what());
        } catch (const boost::bad_rational& e) {
            Bad("argument " + std::to_string(i + 1) + " (" + what + ") cannot be read: " + e.what());
        }
    }

    [[noreturn]] void Bad(const std::string& why) const {
        throw BadArguments("Bad arguments for " + mMessage + " " + mSignature + ": " + why);
    }

private:
    const platform::Value& mArgs;
    std::string mMessage;
    const char* mSignature;
};

}  // namespace tidelink::peer

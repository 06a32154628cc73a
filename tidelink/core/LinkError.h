// The library's exception: thrown only while finding or launching the link manager.
#pragma once

#include <stdexcept>
#include <string>

#include "platform/Export.h"

namespace tidelink {

class TIDELINK_EXPORT LinkError : public std::runtime_error {
public:
    explicit LinkError(const std::string& message) : std::runtime_error(message) {}
    ~LinkError() override;
};

inline constexpr const char* kCannotFindServer = "Cannot find TideLink Server";
inline constexpr const char* kErrorLaunchingManager = "Error launching TideLinkManager";
inline constexpr const char* kUnableToConnectToManager = "Unable to connect to TideLinkManager";

}  // namespace tidelink

// Records that describe an open project and its items, as peers send them in replies.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "platform/Export.h"
#include "platform/Guid.h"
#include "platform/Serialization.h"
#include "platform/Strings.h"
#include "tidelink/peers/LinkRecords.h"

namespace tidelink {

// What a peer could not find when it opened a project.
struct TIDELINK_EXPORT MissingAssets {
    struct Font {
        std::string mFamily;
        std::string mStyle;
        std::string mPostScriptName;
        std::string mFullName;
        int64_t mFontType = 0;
        friend bool operator==(const Font&, const Font&) = default;
    };
    struct Plugin {
        std::string mMatchName;
        friend bool operator==(const Plugin&, const Plugin&) = default;
    };
    struct Footage {
        WString mPath;
        friend bool operator==(const Footage&, const Footage&) = default;
    };

    std::vector<Font> mMissingFonts;
    std::vector<Plugin> mMissingPlugins;
    std::vector<Footage> mMissingFootage;

    bool IsEmpty() const {
        return mMissingFonts.empty() && mMissingPlugins.empty() && mMissingFootage.empty();
    }
    friend bool operator==(const MissingAssets&, const MissingAssets&) = default;
};

// One project item: a bin, a composition, footage... The type values belong to the peer.
struct TIDELINK_EXPORT ItemInfo {
    WString mName;
    Guid mID;
    int32_t mType = 0;
    friend bool operator==(const ItemInfo&, const ItemInfo&) = default;
};

namespace projectprotocol {

// The description of an open project in replies.
struct TIDELINK_EXPORT ProjectInfo {
    WString mName;
    File mFile;
    MissingAssets mMissingAssets;
    FarlandProductionInfo mFarlandProductionInfo;
    friend bool operator==(const ProjectInfo&, const ProjectInfo&) = default;
};

TIDELINK_EXPORT void to_json(platform::Value& j, const ProjectInfo& r);
TIDELINK_EXPORT void from_json(const platform::Value& j, ProjectInfo& r);

}  // namespace projectprotocol

TIDELINK_EXPORT void to_json(platform::Value& j, const MissingAssets& r);
TIDELINK_EXPORT void from_json(const platform::Value& j, MissingAssets& r);
TIDELINK_EXPORT void to_json(platform::Value& j, const ItemInfo& r);
TIDELINK_EXPORT void from_json(const platform::Value& j, ItemInfo& r);

}  // namespace tidelink

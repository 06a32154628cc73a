// The reference peer's project documents (docs/projects.md): a JSON file holding a tree of bins,
// compositions and footage. ProjectModel is the parsed, validated, read-only form of one document,
// with every item reachable by its id.
//
// Threading: a ProjectModel is immutable once built; any thread may read it. Parsing is a pure
// function of the text, the project file's path and the file system (footage is looked up to
// tell which files are missing).
#pragma once

#include <cstdint>
#include <filesystem>
#include <map>
#include <optional>
#include <stdexcept>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include <boost/rational.hpp>

#include "platform/Guid.h"
#include "platform/Serialization.h"
#include "platform/media/MediaTypes.h"
#include "tidelink/peers/ProjectProtocol.h"

namespace tidelink::peer {

using platform::Guid;
using Rational = boost::rational<int64_t>;
// Products of two rational parts are computed exactly in 128 bits (a GCC and Clang extension).
__extension__ typedef __int128 Int128;

// Why a document could not be read. what() is the full sentence, e.g.
// "/items/0/frameRate: expected a positive rational such as [30000, 1001]".
class ProjectError : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
};

// The numbers that travel as ItemInfo "type".
enum class ItemType : int32_t {
    Bin = 1,
    Composition = 2,
    Footage = 3,
};

// 8-bit straight-alpha colour.
struct Color8 {
    uint8_t r = 0;
    uint8_t g = 0;
    uint8_t b = 0;
    uint8_t a = 255;
    friend bool operator==(const Color8&, const Color8&) = default;
};

// In composition pixels.
struct PixelRect {
    int32_t x = 0;
    int32_t y = 0;
    int32_t width = 0;
    int32_t height = 0;
    friend bool operator==(const PixelRect&, const PixelRect&) = default;
};

struct PatternLayer {};

struct SolidLayer {
    Color8 color;
    std::optional<PixelRect> rect;  // whole frame when absent
};

struct GradientLayer {
    enum class Direction { Horizontal, Vertical };
    Color8 from;
    Color8 to{255, 255, 255, 255};
    Direction direction = Direction::Horizontal;
    std::optional<PixelRect> rect;
};

struct ToneLayer {
    double frequency = 440.0;   // Hz, > 0
    double amplitude = 0.1;     // linear, from "level" in dBFS
    std::vector<int32_t> channels;  // 0-based channel indices; empty = every channel
};

struct FootageRef {
    std::string path;                 // as written in the document
    std::filesystem::path resolved;   // absolute, lexically normal
    bool missing = false;
};

struct Layer {
    std::string name;
    Rational start{0};                // composition time in seconds; active in [start, end)
    std::optional<Rational> end;      // to the end of the composition when absent
    std::variant<PatternLayer, SolidLayer, GradientLayer, ToneLayer, FootageRef> content;

    bool ActiveAt(const Rational& t) const { return t >= start && (!end || t < *end); }
};

struct Composition {
    int32_t width = 1920;
    int32_t height = 1080;
    platform::PixelAspectRatio pixelAspectRatio;
    Rational frameRate{25};           // frames per second
    Rational duration{10};            // seconds
    int32_t sampleRate = 48000;       // samples per second
    platform::AudioChannelLayout channels;  // stereo by default
    Color8 background{0, 0, 0, 255};
    std::vector<Layer> layers;        // drawn in order: the first is at the bottom

    int64_t FrameCount() const;       // whole and partial frames within the duration
    bool HasVideo() const { return true; }
    bool HasAudio() const;            // any tone layer
};

struct Item {
    ItemType type = ItemType::Bin;
    std::string name;
    Guid id;
    std::string path;                 // names from the root joined with "/"; "" for the root
    Guid parent;                      // nil for the root
    std::vector<size_t> children;     // indices into ProjectModel::Items()
    std::optional<Composition> composition;  // for compositions
    std::optional<FootageRef> footage;       // for footage items
};

// What OpenProjectWithJSON may change before the document is read (docs/projects.md):
// {"document": merge patch over the whole document,
//  "items": {"<item id or item path>": merge patch over that item}}.
struct DocumentOverrides {
    platform::Value document;         // null when absent
    std::vector<std::pair<std::string, platform::Value>> items;
};

// Reads the JSON text of OpenProjectWithJSON. Empty text means no overrides. Throws ProjectError.
DocumentOverrides ParseOverrides(std::string_view json);

// An item to add to an open project (created by a host): a bin with what it holds, a composition
// or a footage item.
struct NewItem {
    ItemType type = ItemType::Bin;
    std::string name;
    std::optional<Guid> id;                   // a fresh id when absent or already taken
    std::optional<Composition> composition;   // compositions
    std::string footagePath;                  // footage: as given, relative to the project's folder
    std::vector<NewItem> children;            // bins
};

class ProjectModel {
public:
    // Limits on what one document may hold.
    static constexpr size_t kMaxFileBytes = 64u << 20;
    static constexpr size_t kMaxItems = 100000;
    static constexpr size_t kMaxLayers = 1000;
    static constexpr int32_t kMaxDimension = 16384;

    // Reads a document. |projectFile| is the absolute path it was read from; footage paths are
    // relative to its folder, and the project's name falls back to its stem. Throws ProjectError.
    static ProjectModel Parse(std::string_view text, const std::filesystem::path& projectFile,
                              const DocumentOverrides& overrides = {});
    // Reads the file. Throws ProjectError (missing or unreadable files included).
    static ProjectModel Load(const std::filesystem::path& projectFile,
                             const DocumentOverrides& overrides = {});

    // The text of a new, empty project named |name|.
    static std::string EmptyDocument(const std::string& name);

    const std::string& Name() const { return mName; }
    const std::filesystem::path& File() const { return mFile; }
    const std::vector<Item>& Items() const { return mItems; }
    // The root bin: holds the document's top-level items. Its id is the document's "id" or the
    // id derived from the empty path.
    const Item& Root() const { return mItems.front(); }
    // nullptr when no item has |id|. The nil GUID names the root.
    const Item* Find(const Guid& id) const;
    const Item* FindByPath(std::string_view path) const;

    // A copy of this model with |items| added, in order, at the end of the bin |parent| (the nil
    // GUID names the root). Names follow the document's rules; footage paths (of items and of
    // layers) are resolved against the project's folder and missing files are added to Missing().
    // |added| receives the ids of the new top-level items. Throws ProjectError when |parent| is
    // not a bin of the project, a name is unusable, or the project would hold too many items.
    ProjectModel WithItems(const Guid& parent, std::vector<NewItem> items, std::vector<Guid>* added = nullptr) const;

    tidelink::ItemInfo InfoOf(const Item& item) const;
    std::vector<tidelink::ItemInfo> ChildrenOf(const Item& item) const;
    const MissingAssets& Missing() const { return mMissing; }
    projectprotocol::ProjectInfo Info() const;

private:
    ProjectModel() = default;
    friend class DocumentReader;
    std::string mName;
    std::filesystem::path mFile;
    std::vector<Item> mItems;
    std::map<Guid, size_t> mById;
    MissingAssets mMissing;
};

// The id an item without an explicit "id" gets: a name-based GUID of its path, the same every
// time the document is read.
Guid DeriveItemId(std::string_view itemPath);

}  // namespace tidelink::peer

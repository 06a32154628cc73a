// Feeds arbitrary bytes to the reference peer's project reader: the bytes up to the first NUL are
// the document, the rest (when present) the overrides of OpenProjectWithJSON. Reading must either
// give a whole, consistent model or throw ProjectError; a model read must answer every lookup,
// survive its reply record's round trip, and render a small frame and a few samples of every
// composition. Seed it with the examples: fuzz_project examples/projects
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <set>
#include <string_view>
#include <vector>

#include "Generators.h"
#include "ProjectModel.h"

using namespace tidelink;
using namespace tidelink::peer;

namespace {

void CheckModel(const ProjectModel& m) {
    const auto& items = m.Items();
    if (items.empty() || m.Find(platform::Guid()) != &items.front()) abort();
    std::set<platform::Guid> ids;
    for (size_t i = 0; i < items.size(); ++i) {
        const Item& item = items[i];
        if (!ids.insert(item.id).second) abort();
        if (m.Find(item.id) != &item) abort();
        if (m.FindByPath(item.path) == nullptr) abort();
        for (size_t child : item.children) {
            if (child <= i || child >= items.size() || items[child].parent != item.id) abort();
        }
        if (m.ChildrenOf(item).size() != item.children.size()) abort();
        if ((item.type == ItemType::Composition) != item.composition.has_value()) abort();
        if ((item.type == ItemType::Footage) != item.footage.has_value()) abort();
        if (!item.composition) continue;
        const Composition& c = *item.composition;
        if (c.width < 1 || c.height < 1 || c.frameRate <= 0 || c.duration <= 0 || c.channels.empty()) abort();
        // A few frames and samples, at small sizes (the geometry scales).
        std::vector<uint8_t> frame(48 * 8 * 4);
        for (const Rational t : {Rational(0), c.duration / 2, c.duration}) {
            RenderCompositionFrame(c, t, FrameView{frame.data(), 48, 8, 48 * 4});
            RenderCompositionFrame(c, t, FrameView{frame.data(), 3, 2, 3 * 4});
        }
        std::vector<float> audio(64 * c.channels.size());
        RenderCompositionAudio(c, 0, 64, audio.data());
        RenderCompositionAudio(c, INT64_MAX - 10, 64, audio.data());
        for (float v : audio) {
            if (!(v >= -1.0f && v <= 1.0f)) abort();
        }
    }
    const platform::Value info = m.Info();
    if (!(info.get<projectprotocol::ProjectInfo>() == m.Info())) abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string_view input(reinterpret_cast<const char*>(data), size);
    const size_t split = input.find('\0');
    const std::string_view document = input.substr(0, split);
    DocumentOverrides overrides;
    if (split != std::string_view::npos) {
        try {
            overrides = ParseOverrides(input.substr(split + 1));
        } catch (const ProjectError&) {
            return 0;
        }
    }
    try {
        CheckModel(ProjectModel::Parse(document, "/fuzz/project.kstproj", overrides));
    } catch (const ProjectError&) {
    }
    return 0;
}

// Feeds arbitrary bytes to the reference peer's reader of items in XML. Reading must either give
// items or throw ItemsXmlError (never crash, hang or recurse without bound); items read must go
// into a project, write back, and read back to the same text. The composition reader must take
// the same text over a base. Seed it with texts GetItemsAsXML writes.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "ItemsXml.h"
#include "ProjectModel.h"

using namespace tidelink;
using namespace tidelink::peer;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string_view input(reinterpret_cast<const char*>(data), size);
    try {
        ItemsDocument doc = ReadItemsXml(input);
        static const ProjectModel empty = ProjectModel::Parse(ProjectModel::EmptyDocument("Fuzz"), "/fuzz/Fuzz.kstproj");
        try {
            const ProjectModel model = empty.WithItems(platform::Guid(), std::move(doc.items));
            std::vector<const Item*> top;
            for (size_t i : model.Root().children) top.push_back(&model.Items()[i]);
            const std::string written = WriteItemsXml(model, top);
            const ItemsDocument again = ReadItemsXml(written);
            const ProjectModel copy = empty.WithItems(platform::Guid(), again.items);
            std::vector<const Item*> copyTop;
            for (size_t i : copy.Root().children) copyTop.push_back(&copy.Items()[i]);
            if (WriteItemsXml(copy, copyTop) != written) abort();
        } catch (const ProjectError&) {
            // Names the document would refuse, or too many items.
        }
    } catch (const ItemsXmlError&) {
    }
    try {
        Composition base;
        base.channels = platform::CreateStereoChannelLayout();
        std::string name;
        (void)ReadCompositionXml(input, base, &name);
    } catch (const ItemsXmlError&) {
    }
    return 0;
}

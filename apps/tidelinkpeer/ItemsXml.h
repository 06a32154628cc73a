// The reference peer's XML form of project items (docs/items-xml.md): what GetItemsAsXML and
// GetXMLDescription answer, and what CreateItemsFromXML and CreateSourceFromXML read.
//
//   <tidelink-items version="1" project="/abs/Demo.kstproj">
//     <bin name="Compositions" id="...">
//       <composition name="Demo" id="..." width="1920" height="1080" frameRate="30000/1001"
//                    duration="1001/100" sampleRate="48000" channels="left right">
//         <pattern name="Frame code"/>
//         <solid name="Box" color="#ff8000ff" rect="860 440 200 200" start="1001/1000" end="5005/1000"/>
//         <tone name="A 440" frequency="440" amplitude="0.1" channels="0"/>
//       </composition>
//     </bin>
//     <footage name="Clip" id="..." path="media/clip.mov"/>
//   </tidelink-items>
//
// The reader is strict (unknown elements and attributes are errors, so that a misspelling is not
// silently ignored), bounded (16 MiB of text, 64 levels, 200,000 elements) and knows no document
// type declarations, so no entity can expand. Pure functions; thread-safe.
#pragma once

#include <cstdint>
#include <optional>
#include <stdexcept>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "ProjectModel.h"

namespace tidelink::peer {

// Why a text could not be read: "line 3: <solid> needs a \"color\"".
class ItemsXmlError : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
};

inline constexpr size_t kMaxXmlBytes = 16u << 20;
inline constexpr int kMaxXmlDepth = 64;
inline constexpr size_t kMaxXmlElements = 200000;

// ---- generic XML ----

struct XmlElement {
    std::string name;
    std::vector<std::pair<std::string, std::string>> attributes;  // in document order, decoded
    std::vector<XmlElement> children;
    int line = 0;

    const std::string* Attribute(std::string_view key) const;
};

// Reads a document of elements and attributes: the XML declaration, processing instructions and
// comments are skipped; text other than white space, CDATA sections and document type
// declarations are refused. Throws ItemsXmlError.
XmlElement ParseXml(std::string_view text);

// ---- the items dialect ----

// A text of items to add to a project (CreateItemsFromXML).
struct ItemsDocument {
    std::string project;  // the "project" attribute: the project file, or empty
    std::string parent;   // the "parent" attribute: a bin's id or path, or empty for the root
    std::vector<NewItem> items;
};

// The items of |model| listed in |items| (bins with everything they hold), as a document whose
// "project" is the model's file.
std::string WriteItemsXml(const ProjectModel& model, const std::vector<const Item*>& items);

// Reads a <tidelink-items> document. Compositions are checked as a document's would be. Throws
// ItemsXmlError.
ItemsDocument ReadItemsXml(std::string_view text);

// Reads the first <composition> of |text| (the root element itself, or the first one in document
// order) over |base|: the attributes it gives replace base's, its layers (when it has any)
// replace base's layers. Sets |name| to its "name" when it has one. Nothing when the text holds
// no <composition> (XML of another dialect). The result is not checked (ValidateComposition).
// Throws ItemsXmlError for text that is not XML or a <composition> that cannot be read.
std::optional<Composition> ReadCompositionXml(std::string_view text, const Composition& base, std::string* name);

}  // namespace tidelink::peer

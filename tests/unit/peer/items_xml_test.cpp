// The XML form of project items: the reader's limits and errors, and round trips through
// projects (write, read, add to another project, write again).
#include <gtest/gtest.h>

#include <string>

#include "ItemsXml.h"
#include "PeerTestSupport.h"
#include "ProjectModel.h"
#include "SourceDescription.h"

using namespace tidelink;
using namespace tidelink::peer;
using tidelink::peer::test::ExamplesDir;
using tidelink::peer::test::TempDir;

namespace {

std::string ErrorOf(std::string_view text) {
    try {
        ReadItemsXml(text);
    } catch (const ItemsXmlError& e) {
        return e.what();
    }
    return "(accepted)";
}

std::vector<const Item*> TopLevel(const ProjectModel& m) {
    std::vector<const Item*> out;
    for (size_t i : m.Root().children) out.push_back(&m.Items()[i]);
    return out;
}

// The text without its project="..." attribute.
std::string WithoutProject(std::string xml) {
    const size_t at = xml.find(" project=\"");
    const size_t end = xml.find('"', at + 10);
    return xml.erase(at, end + 1 - at);
}

ProjectModel EmptyProject(const TempDir& dir, const std::string& name) {
    const auto file = dir.Write(name + ".kstproj", ProjectModel::EmptyDocument(name));
    return ProjectModel::Load(file);
}

}  // namespace

TEST(XmlReaderTest, ReadsElementsAttributesAndReferences) {
    const XmlElement root = ParseXml(
        "\xEF\xBB\xBF<?xml version=\"1.0\"?>\n<!-- a comment -->\n"
        "<a x='1 &lt;2&gt; &amp; &quot;q&quot; &apos;s&apos;' y=\"&#65;&#x42;&#x20AC;\">\n"
        "  <b/><?pi stuff?>\n  <c z = \"\" ><!-- inside --></c>\n</a>\n<!-- after -->");
    EXPECT_EQ(root.name, "a");
    ASSERT_NE(root.Attribute("x"), nullptr);
    EXPECT_EQ(*root.Attribute("x"), "1 <2> & \"q\" 's'");
    EXPECT_EQ(*root.Attribute("y"), "AB\xE2\x82\xAC");
    ASSERT_EQ(root.children.size(), 2u);
    EXPECT_EQ(root.children[1].name, "c");
    EXPECT_EQ(*root.children[1].Attribute("z"), "");
    EXPECT_EQ(root.children[1].line, 5);
}

TEST(XmlReaderTest, RefusesWhatTheDialectDoesNotUse) {
    const std::pair<const char*, const char*> cases[] = {
        {"<!DOCTYPE a [<!ENTITY e \"x\">]><a/>", "document type"},
        {"<a x=\"&e;\"/>", "unknown entity"},
        {"<a x=\"&#0;\"/>", "character reference"},
        {"<a x=\"&#xD800;\"/>", "character reference"},
        {"<a x=\"&#99999999;\"/>", "character reference"},
        {"<a>text</a>", "text is not accepted"},
        {"<a><![CDATA[x]]></a>", "CDATA"},
        {"<a><b></a>", "</a> closes <b>"},
        {"<a>", "not closed"},
        {"<a x=\"1\" x=\"2\"/>", "two attributes"},
        {"<a x=\"1\"y=\"2\"/>", "white space"},
        {"<a x=1/>", "quoted"},
        {"<a x=\"<\"/>", "'<'"},
        {"<a/><b/>", "after the root"},
        {"", "expected an element"},
        {"<a x=\"1", "unterminated"},
        {"<!-- open", "unterminated comment"},
    };
    for (const auto& [text, words] : cases) {
        try {
            ParseXml(text);
            ADD_FAILURE() << "accepted " << text;
        } catch (const ItemsXmlError& e) {
            EXPECT_NE(std::string(e.what()).find(words), std::string::npos) << text << " -> " << e.what();
        }
    }
}

TEST(XmlReaderTest, LimitsDepthAndSizeWithoutRecursing) {
    std::string deep;
    for (int i = 0; i < 64; ++i) deep += "<e>";
    for (int i = 0; i < 64; ++i) deep += "</e>";
    EXPECT_NO_THROW(ParseXml(deep));
    std::string deeper;
    for (int i = 0; i < 100000; ++i) deeper += "<e>";
    EXPECT_THROW(ParseXml(deeper), ItemsXmlError);
    EXPECT_THROW(ParseXml("<a>" + std::string(kMaxXmlBytes, ' ') + "</a>"), ItemsXmlError);
    std::string wide = "<a>";
    for (size_t i = 0; i <= kMaxXmlElements; ++i) wide += "<b/>";
    wide += "</a>";
    EXPECT_THROW(ParseXml(wide), ItemsXmlError);
}

TEST(ItemsXmlTest, ProjectItemsSurviveARoundTripThroughAnotherProject) {
    TempDir dir;
    for (const char* file : {"demo.kstproj", "show.pufproj", "titles.ospproj"}) {
        const ProjectModel source = ProjectModel::Load(ExamplesDir() / file);
        const std::string xml = WriteItemsXml(source, TopLevel(source));
        const ItemsDocument doc = ReadItemsXml(xml);
        EXPECT_EQ(doc.project, source.File().string());
        const ProjectModel copy = EmptyProject(dir, std::string("copy-") + file).WithItems(platform::Guid(), doc.items);
        // Same items, same ids (all free in the new project), same compositions to the last bit.
        EXPECT_EQ(WithoutProject(WriteItemsXml(copy, TopLevel(copy))), WithoutProject(xml)) << file;
        for (const Item& item : source.Items()) {
            if (&item == &source.Root()) continue;
            const Item* same = copy.Find(item.id);
            ASSERT_NE(same, nullptr) << item.path;
            EXPECT_EQ(same->path, item.path);
        }
    }
}

TEST(ItemsXmlTest, NamesAndPathsWithMarkupCharactersAreEscaped) {
    TempDir dir;
    ItemsDocument doc = ReadItemsXml(
        "<tidelink-items><bin name=\"&lt;A &amp; B&gt; &quot;x&quot;\"><footage name=\"f'\" "
        "path=\"media/a&amp;b.mov\"/></bin></tidelink-items>");
    const ProjectModel model = EmptyProject(dir, "p").WithItems(platform::Guid(), doc.items);
    const std::string xml = WriteItemsXml(model, TopLevel(model));
    EXPECT_NE(xml.find("name=\"&lt;A &amp; B&gt; &quot;x&quot;\""), std::string::npos) << xml;
    const ItemsDocument again = ReadItemsXml(xml);
    ASSERT_EQ(again.items.size(), 1u);
    EXPECT_EQ(again.items[0].name, "<A & B> \"x\"");
    EXPECT_EQ(again.items[0].children[0].footagePath, "media/a&b.mov");
}

TEST(ItemsXmlTest, ReportsWhatIsWrongWithItsLine) {
    EXPECT_NE(ErrorOf("<items/>").find("expected <tidelink-items>"), std::string::npos);
    EXPECT_NE(ErrorOf("<tidelink-items version=\"2\"/>").find("version 2"), std::string::npos);
    EXPECT_NE(ErrorOf("<tidelink-items>\n<bin/></tidelink-items>").find("line 2: <bin> needs a \"name\""),
              std::string::npos);
    EXPECT_NE(ErrorOf("<tidelink-items><bin name=\"b\" colour=\"x\"/></tidelink-items>").find("unknown attribute \"colour\""),
              std::string::npos);
    EXPECT_NE(ErrorOf("<tidelink-items><clip name=\"b\"/></tidelink-items>").find("is not an item"), std::string::npos);
    EXPECT_NE(ErrorOf("<tidelink-items><bin name=\"b\" id=\"nope\"/></tidelink-items>").find("GUID"), std::string::npos);
    const std::string comp = "<tidelink-items><composition name=\"c\" width=\"64\" height=\"64\" frameRate=\"25\" duration=\"1\"";
    EXPECT_NE(ErrorOf(comp + " width=\"1\"/></tidelink-items>").find("two attributes"), std::string::npos);
    EXPECT_NE(ErrorOf("<tidelink-items><composition name=\"c\" width=\"64\" height=\"64\" duration=\"1\"/></tidelink-items>")
                  .find("needs a \"frameRate\""),
              std::string::npos);
    EXPECT_NE(ErrorOf(comp + " frameRate2=\"1\"/></tidelink-items>").find("unknown attribute"), std::string::npos);
    EXPECT_NE(ErrorOf(comp + "><tone frequency=\"30000\"/></composition></tidelink-items>").find("half the sample rate"),
              std::string::npos);
    EXPECT_NE(ErrorOf(comp + "><tone frequency=\"300\" channels=\"2\"/></composition></tidelink-items>").find("channel 2"),
              std::string::npos);
    EXPECT_NE(ErrorOf(comp + "><solid color=\"red\"/></composition></tidelink-items>").find("colour"), std::string::npos);
    EXPECT_NE(ErrorOf(comp + "><solid color=\"#ffffff\" rect=\"1 2 3\"/></composition></tidelink-items>").find("rect"),
              std::string::npos);
    EXPECT_NE(ErrorOf(comp + "><solid color=\"#ffffff\" start=\"2\" end=\"1\"/></composition></tidelink-items>")
                  .find("ends before it starts"),
              std::string::npos);
    EXPECT_NE(ErrorOf(comp + "><tone frequency=\"440\" level=\"-3\" amplitude=\"0.5\"/></composition></tidelink-items>")
                  .find("both"),
              std::string::npos);
    EXPECT_NE(ErrorOf(comp + " frameRate=\"29.97\"/></tidelink-items>").find("two attributes"), std::string::npos);
    EXPECT_NE(ErrorOf("<tidelink-items><composition name=\"c\" width=\"64\" height=\"64\" frameRate=\"29.97\" "
                      "duration=\"1\"/></tidelink-items>")
                  .find("30000/1001"),
              std::string::npos);
    EXPECT_NE(ErrorOf(comp + "><pattern><solid color=\"#ffffff\"/></pattern></composition></tidelink-items>")
                  .find("layers hold none"),
              std::string::npos);
}

TEST(ItemsXmlTest, CompositionOverABaseKeepsWhatTheTextLeavesOut) {
    Composition base;
    base.width = 640;
    base.height = 360;
    base.frameRate = Rational(50);
    base.duration = Rational(3);
    base.channels = platform::CreateStereoChannelLayout();
    base.layers.push_back(Layer{"p", Rational(0), std::nullopt, PatternLayer{}});
    std::string name;
    Composition c = *ReadCompositionXml("<composition name=\"N\" width=\"320\" duration=\"5/2\"/>", base, &name);
    EXPECT_EQ(name, "N");
    EXPECT_EQ(c.width, 320);
    EXPECT_EQ(c.height, 360);
    EXPECT_EQ(c.frameRate, Rational(50));
    EXPECT_EQ(c.duration, Rational(5, 2));
    ASSERT_EQ(c.layers.size(), 1u);  // no layers given: the base's stay
    c = *ReadCompositionXml(
        "<tidelink-items><bin name=\"b\"><composition background=\"#102030\"><solid color=\"#ff0000\" "
        "rect=\"0 0 10 10\"/><tone level=\"-6\" frequency=\"100\"/></composition></bin></tidelink-items>",
        base, &name);
    EXPECT_EQ(name, "N");  // unchanged: the text names none
    EXPECT_EQ(c.background, (Color8{0x10, 0x20, 0x30, 255}));
    ASSERT_EQ(c.layers.size(), 2u);
    EXPECT_NEAR(std::get<ToneLayer>(c.layers[1].content).amplitude, 0.5012, 1e-4);
    // Another application's XML holds no composition of ours; text that is not XML is refused.
    EXPECT_FALSE(ReadCompositionXml("<items><clip/></items>", base, &name).has_value());
    EXPECT_THROW(ReadCompositionXml("<items>", base, &name), ItemsXmlError);
    EXPECT_THROW(ReadCompositionXml("<composition width=\"0\"/>", base, &name), ItemsXmlError);
}

// ---- adding items to a project ----

TEST(AddItemsTest, NewItemsGetPathsIdsAndTheirFootageLookedUp) {
    TempDir dir;
    dir.Write("media/there.mov", "x");
    const ProjectModel model = ProjectModel::Load(ExamplesDir() / "demo.kstproj");
    const ProjectModel project = ProjectModel::Parse(
        ProjectModel::EmptyDocument("P"), dir.Path() / "P.kstproj");
    const Item& demo = *model.FindByPath("Compositions/Demo 1080p25");

    NewItem comp{ItemType::Composition, "Demo 1080p25", demo.id, demo.composition, "", {}};
    NewItem twin = comp;
    NewItem footage{ItemType::Footage, "Clip", std::nullopt, std::nullopt, "media/there.mov", {}};
    NewItem gone{ItemType::Footage, "Gone", std::nullopt, std::nullopt, "media/gone.mov", {}};
    NewItem bin{ItemType::Bin, "Bin", std::nullopt, std::nullopt, "", {footage, gone}};
    std::vector<platform::Guid> added;
    const ProjectModel grown = project.WithItems(platform::Guid(), {comp, twin, bin}, &added);

    ASSERT_EQ(added.size(), 3u);
    EXPECT_EQ(added[0], demo.id);  // free here, so kept
    EXPECT_NE(added[1], demo.id);  // taken by the first: a fresh one
    EXPECT_EQ(grown.Find(added[1])->path, "Demo 1080p25#2");
    EXPECT_EQ(grown.Find(added[0])->composition->layers.size(), demo.composition->layers.size());
    const Item* clip = grown.FindByPath("Bin/Clip");
    ASSERT_NE(clip, nullptr);
    EXPECT_FALSE(clip->footage->missing);
    EXPECT_EQ(clip->footage->resolved, dir.Path() / "media/there.mov");
    EXPECT_TRUE(grown.FindByPath("Bin/Gone")->footage->missing);
    ASSERT_EQ(grown.Missing().mMissingFootage.size(), 1u);
    EXPECT_EQ(platform::ToUTF8(grown.Missing().mMissingFootage[0].mPath), (dir.Path() / "media/gone.mov").string());
    // The model it came from is unchanged, and the new bin can take more.
    EXPECT_EQ(project.Items().size(), 1u);
    const ProjectModel more = grown.WithItems(grown.FindByPath("Bin")->id, {gone});
    EXPECT_NE(more.FindByPath("Bin/Gone#2"), nullptr);
    EXPECT_EQ(more.Missing().mMissingFootage.size(), 1u);  // reported once
}

TEST(AddItemsTest, RefusesUnusableParentsAndNames) {
    const ProjectModel model = ProjectModel::Load(ExamplesDir() / "demo.kstproj");
    const NewItem bin{ItemType::Bin, "B", std::nullopt, std::nullopt, "", {}};
    EXPECT_THROW(model.WithItems(platform::Guid::New(), {bin}), ProjectError);
    EXPECT_THROW(model.WithItems(model.FindByPath("Compositions/Demo 1080p25")->id, {bin}), ProjectError);
    for (const char* name : {"", "a/b"}) {
        NewItem bad = bin;
        bad.name = name;
        EXPECT_THROW(model.WithItems(platform::Guid(), {bad}), ProjectError) << name;
    }
    NewItem formatless{ItemType::Composition, "C", std::nullopt, std::nullopt, "", {}};
    EXPECT_THROW(model.WithItems(platform::Guid(), {formatless}), ProjectError);
}

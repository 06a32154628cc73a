// What the reference peer tells hosts about its items (docs/peer.md, "Sources"): the SourceInfo
// of a composition or footage item, the composition a host asks to create from a SourceInfo, and
// the metadata packet of a source.
//
// Pure functions; thread-safe.
#pragma once

#include <string>

#include "ProjectModel.h"
#include "tidelink/peers/LinkRecords.h"

namespace tidelink::peer {

// The description of |item| (a composition or footage item of |model|). |producer| becomes the
// media producer description (the serving application's name). Throws ProjectError for a bin.
SourceInfo DescribeSource(const ProjectModel& model, const Item& item, const std::string& producer);

// The composition a host asks for with CreateSource: size from the frame rectangle, rate,
// duration, pixel aspect ratio and audio format from |info| (size, rate and duration are
// required; audio defaults to 48 kHz stereo); the test pattern, and a 1 kHz tone at -20 dBFS on
// every channel. Throws ProjectError naming what is missing or out of range. With |strict| false
// nothing is required or checked: what |info| leaves unset keeps the defaults of Composition.
Composition CompositionFromSourceInfo(const SourceInfo& info, bool strict = true);

// Overwrites the members of |comp| that |info| sets: a frame rectangle with a size, a set frame
// rate, a positive duration, a pixel aspect ratio without zeros, a set audio rate, a non-empty
// channel layout. Does not check the result (ValidateComposition does).
void ApplySourceInfo(const SourceInfo& info, Composition& comp);

// Checks what the project reader checks of a composition read from a document: sizes, rates,
// duration, audio format, layer times, rectangles, tone frequencies and channels. Throws
// ProjectError.
void ValidateComposition(const Composition& comp);

// The metadata packet of |item| between |start| and |end| (seconds): an XMP packet with the
// item's title and our own properties (duration, frame size and rate, range).
std::string MetadataPacket(const ProjectModel& model, const Item& item, const platform::RatioTime& start,
                           const platform::RatioTime& end);

// "&", "<", ">", quotes and control characters as XML character references.
std::string EscapeXml(std::string_view text);

}  // namespace tidelink::peer

#pragma once

#include <cstdint>
#include <string>

#include <tinyxml.h>

namespace ko::core {

// Fills an empty document with the envelope: declaration, root Qora (with
// Delta="0" when asked) and an Update element whose first attribute is
// ID="3670016". Returns the Update element.
TiXmlElement* buildEnvelope(TiXmlDocument& doc, bool withDelta);

// Compact text for the host: no indentation or line breaks.
std::string printCompact(const TiXmlDocument& doc);
// Default pretty printing (four-space indent, LF line ends), as stored on disk.
std::string printPretty(const TiXmlDocument& doc);

// Sends a printed document with type 0x1000010 to `target`.
void sendXmlToHost(uint32_t target, const char* text, uint64_t length);
inline void sendXmlToHost(uint32_t target, const std::string& text) {
  sendXmlToHost(target, text.data(), text.size());
}

// Reads an integer attribute the way %d scanning does; false when missing or
// not starting with a decimal integer.
bool readIntAttribute(const TiXmlElement* element, const char* name, int32_t* value);

// True when `text` nests elements deeper than `maxDepth` levels; such
// documents are refused before TinyXML's recursive parser sees them.
bool nestsDeeperThan(const char* text, size_t length, int maxDepth);

// Parses an incoming document from the host: false for text that does not
// parse or nests deeper than 100 levels.
bool parseHostDocument(const unsigned char* data, size_t length, TiXmlDocument* doc);

// The module announcement for this build's four-part version.
std::string announcementText(const char* version);
void announceModule(const char* version);

}  // namespace ko::core

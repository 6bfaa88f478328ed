#include "Sorvik/plugin/xml_envelope.h"

#include <cerrno>
#include <cstdlib>
#include <limits>

#include "Sorvik/plugin/host_callback.h"
#include "Sorvik/plugin/module.h"

namespace ko::core {
namespace {

constexpr int kMaxDocumentDepth = 100;

TiXmlElement* addRoot(TiXmlDocument& doc, bool withDelta) {
  doc.Clear();
  doc.LinkEndChild(new TiXmlDeclaration("", "", ""));
  auto* root = new TiXmlElement("Qora");
  if (withDelta) root->SetAttribute("Delta", 0);
  doc.LinkEndChild(root);
  return root;
}

bool isNameStart(char c) {
  return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || c == '_' || c == ':' ||
         static_cast<unsigned char>(c) >= 0x80;
}

// Position just past `terminator` at or after `from`, or `end` when absent.
size_t skipPast(const char* text, size_t from, size_t end, const char* terminator, size_t termLength) {
  for (size_t i = from; i + termLength <= end; ++i) {
    size_t k = 0;
    while (k < termLength && text[i + k] == terminator[k]) ++k;
    if (k == termLength) return i + termLength;
  }
  return end;
}

}  // namespace

TiXmlElement* buildEnvelope(TiXmlDocument& doc, bool withDelta) {
  TiXmlElement* root = addRoot(doc, withDelta);
  auto* update = new TiXmlElement("Update");
  update->SetAttribute("ID", static_cast<int>(kModuleId));
  root->LinkEndChild(update);
  return update;
}

std::string printCompact(const TiXmlDocument& doc) {
  TiXmlPrinter printer;
  printer.SetStreamPrinting();
  doc.Accept(&printer);
  return printer.Str();
}

std::string printPretty(const TiXmlDocument& doc) {
  TiXmlPrinter printer;
  printer.SetIndent("    ");
  printer.SetLineBreak("\n");
  doc.Accept(&printer);
  return printer.Str();
}

void sendXmlToHost(uint32_t target, const char* text, uint64_t length) {
  HostMessage message = HostMessage::make(kModuleId, target, kTypeXmlDocument, text, length);
  callHost(message);
}

bool readIntAttribute(const TiXmlElement* element, const char* name, int32_t* value) {
  if (element == nullptr) return false;
  const char* text = element->Attribute(name);
  if (text == nullptr) return false;
  // %d-style: leading white space, optional sign, at least one digit. Values
  // outside 32 bits are clamped rather than left to scanf's undefined result.
  const char* p = text;
  while (*p == ' ' || *p == '\t' || *p == '\n' || *p == '\r' || *p == '\f' || *p == '\v') ++p;
  const char* digits = p;
  if (*digits == '+' || *digits == '-') ++digits;
  if (*digits < '0' || *digits > '9') return false;
  errno = 0;
  long long parsed = std::strtoll(p, nullptr, 10);
  if (parsed > std::numeric_limits<int32_t>::max()) parsed = std::numeric_limits<int32_t>::max();
  if (parsed < std::numeric_limits<int32_t>::min()) parsed = std::numeric_limits<int32_t>::min();
  *value = static_cast<int32_t>(parsed);
  return true;
}

bool nestsDeeperThan(const char* text, size_t length, int maxDepth) {
  int depth = 0;
  size_t i = 0;
  while (i < length) {
    if (text[i] != '<') {
      ++i;
      continue;
    }
    if (i + 1 >= length) break;
    const char next = text[i + 1];
    if (next == '!') {
      if (length - i >= 4 && text[i + 2] == '-' && text[i + 3] == '-') {
        i = skipPast(text, i + 4, length, "-->", 3);
      } else if (length - i >= 9 && std::string(text + i, 9) == "<![CDATA[") {
        i = skipPast(text, i + 9, length, "]]>", 3);
      } else {
        i = skipPast(text, i + 2, length, ">", 1);
      }
    } else if (next == '?') {
      i = skipPast(text, i + 2, length, "?>", 2);
    } else if (next == '/') {
      if (depth > 0) --depth;
      i = skipPast(text, i + 2, length, ">", 1);
    } else if (isNameStart(next)) {
      // Walk the tag, honouring quoted attribute values, to see whether it closes itself.
      size_t j = i + 1;
      char quote = 0;
      bool selfClosing = false;
      for (; j < length; ++j) {
        const char c = text[j];
        if (quote != 0) {
          if (c == quote) quote = 0;
        } else if (c == '"' || c == '\'') {
          quote = c;
        } else if (c == '>') {
          selfClosing = text[j - 1] == '/';
          break;
        }
      }
      if (!selfClosing && ++depth > maxDepth) return true;
      i = j + 1;
    } else {
      ++i;
    }
  }
  return false;
}

bool parseHostDocument(const unsigned char* data, size_t length, TiXmlDocument* doc) {
  if (data == nullptr || length == 0) return false;
  const char* text = reinterpret_cast<const char*>(data);
  if (nestsDeeperThan(text, length, kMaxDocumentDepth)) return false;
  const std::string copy(text, length);  // the parser needs a terminated string
  doc->Clear();
  doc->Parse(copy.c_str(), nullptr, TIXML_DEFAULT_ENCODING);
  return !doc->Error();
}

std::string announcementText(const char* version) {
  TiXmlDocument doc;
  TiXmlElement* root = addRoot(doc, true);
  auto* modules = new TiXmlElement("Modules");
  root->LinkEndChild(modules);
  auto* module = new TiXmlElement("Module");
  module->SetAttribute("Name", kModuleName);
  module->SetAttribute("ID", static_cast<int>(kModuleId));
  module->SetAttribute("Version", version);
  modules->LinkEndChild(module);
  return printCompact(doc);
}

void announceModule(const char* version) { sendXmlToHost(kTargetState, announcementText(version)); }

}  // namespace ko::core

#pragma once

// The documents through which the host learns what the plug-in is doing.
// The UpdateService::emit* members send them; the builders here fill a
// document from plain values so that what goes over the wire can be checked
// byte for byte. The envelope comes from Sorvik/plugin/xml_envelope.h.

#include <cstdint>

#include <tinyxml.h>

#include "Sorvik/service/update_service.h"

namespace sorvik {

void buildFailoverStatusDocument(TiXmlDocument& doc, int32_t code, TimeStamp when);
void buildFailbackStatusDocument(TiXmlDocument& doc, int32_t status, TimeStamp when, uint32_t port);
void buildSpareResetStatusDocument(TiXmlDocument& doc, int32_t status, TimeStamp when);

// The ways the stored reports are re-sent. Each takes stateMutex only to
// stamp or copy the record, never while sending.

// FailbackReport stamped now with `port`, then sent.
void emitFailbackReport(UpdateService& service, uint32_t port);
// FailbackReport as stored (stamped first only if it never was).
void emitFailbackReportUnchanged(UpdateService& service);
// FailoverReport stamped now, then its FailoverState sent.
void emitFailoverReportRestamped(UpdateService& service);
// FailoverReport's FailoverState with its stored time (stamped first only if
// it never was).
void emitFailoverReportUnchanged(UpdateService& service);

}  // namespace sorvik

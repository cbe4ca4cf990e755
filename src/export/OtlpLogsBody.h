// The body of an OTLP/HTTP JSON logs export (an ExportLogsServiceRequest) made from spooled
// server-reporting messages. Pure functions: no I/O, callable from any thread.
//
// One request holds one resource (service.name, host.name, service.version) with one scope
// ("sxreporting"), and one log record per message, in the order given:
//   timeUnixNano          the message's spool time; observedTimeUnixNano: when it was exported
//   severityText "INFO" (severityNumber 9)
//   body                  the payload: a kvlistValue for a dictionary; a stored payload that is
//                         not valid JSON goes as a stringValue of its text
//   attributes            sxr.message.id (spool row id, for de-duplication downstream),
//                         sxr.message.kind ("session" or "standalone"), sxr.category, sxr.type,
//                         sxr.reporter_id (the session info's session ID), sxr.service_name,
//                         sxr.client_name, and for session messages sxr.session.spool_id and
//                         sxr.session.token; an attribute whose value is unknown is left out.
// The value mapping is the protobuf JSON mapping's: 64-bit integers travel as decimal strings,
// NaN and infinities as the strings "NaN", "Infinity" and "-Infinity" in doubleValue, binary
// values as base64 in bytesValue. A binary value read back from a JSON store, the object
// {"bytes": [...], "subtype": ...}, is a bytesValue too.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "platform/Clock.h"
#include "sxreporting/types.h"

struct SXOtlpResource {
  std::string serviceName = "sxreportingd";
  std::string serviceVersion;                     // left out when empty
  std::string hostName;                           // left out when empty
  std::map<std::string, std::string> attributes;  // more; these win over the three above
};

// A spooled message as the exporter reads it: an object with the columns id, time (seconds
// since the epoch), session_id (null for a standalone message), category, type, payload_json,
// session_info_json, user_info_json and token. Absent or null columns are tolerated.
using SXOtlpSpooledRow = SXValue;

// The OTLP AnyValue of a JSON value (arrays and objects recursively).
SXValue SXOtlpAnyValue(const SXValue& value);

// The ExportLogsServiceRequest for `rows`, exported at `observed`, in the OTLP JSON form.
SXValue SXOtlpLogsRequest(const std::vector<SXOtlpSpooledRow>& rows, const SXOtlpResource& resource,
                          SXDate observed);

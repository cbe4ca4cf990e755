// The protobuf form of OTLP logs export messages, made with the classes generated from
// third_party/opentelemetry-proto. The exporter builds every request in the OTLP JSON form
// (OtlpLogsBody.h), which is the protobuf JSON mapping of the same messages, so one mapping
// of the spool serves both encodings. Pure functions, callable from any thread.
#pragma once

#include <string>

#include "platform/Status.h"

// The ExportLogsServiceRequest written as OTLP JSON in `json`, serialised as protobuf. Fails
// on a field or value the message cannot hold.
SXResult<std::string> SXOtlpRequestProtobuf(const std::string& json);

// An ExportLogsServiceResponse in protobuf as OTLP JSON text; empty when it cannot be decoded.
std::string SXOtlpResponseJson(const std::string& protobuf);

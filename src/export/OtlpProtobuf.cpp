#include "export/OtlpProtobuf.h"

#include <google/protobuf/util/json_util.h>

#include "opentelemetry/proto/collector/logs/v1/logs_service.pb.h"

namespace otlp = opentelemetry::proto::collector::logs::v1;

SXResult<std::string> SXOtlpRequestProtobuf(const std::string& json) {
  otlp::ExportLogsServiceRequest request;
  auto status = google::protobuf::util::JsonStringToMessage(json, &request);
  if (!status.ok()) return SXFailure(status.ToString());
  std::string bytes;
  if (!request.SerializeToString(&bytes)) return SXFailure("cannot serialise the request");
  return bytes;
}

std::string SXOtlpResponseJson(const std::string& protobuf) {
  otlp::ExportLogsServiceResponse response;
  std::string json;
  if (!response.ParseFromString(protobuf) ||
      !google::protobuf::util::MessageToJsonString(response, &json).ok()) {
    return "";
  }
  return json;
}

# The otlp-http exporter's encodings: protobuf bodies from the upstream OTLP definitions kept
# in third_party/ (no Debian package ships them), gzip bodies with zlib.
find_package(Protobuf REQUIRED)
find_package(ZLIB REQUIRED)
add_subdirectory(third_party/opentelemetry-proto)
target_link_libraries(sxr_export PRIVATE sxreporting_otlp_proto ZLIB::ZLIB)
# service.version of the exported resource.
set_property(SOURCE src/export/OtlpExportOptions.cpp APPEND PROPERTY
             COMPILE_DEFINITIONS SXR_PROJECT_VERSION="${PROJECT_VERSION}")

#include "platform/Log.h"

#include <cstring>

void SXLogWriteV(SXLogFacility& facility, const SXLogScope* scope, SXLogLevel level,
                 const char* file, int line, const char* function, std::string_view format,
                 std::initializer_list<SXFormatArg> args) {
  const char* slash = std::strrchr(file, '/');
  std::string text;
  text.reserve(256);
  ((text += slash ? slash + 1 : file) += ':') += std::to_string(line);
  ((text += ':') += function) += ": ";
  SXFormatAppendV(text, format, args);
  facility.write(scope, level, text);
}

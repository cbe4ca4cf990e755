#include "platform/Log.h"

#include <cstring>

void SXLogWriteV(SXLogFacility& facility, const SXLogScope* scope, SXLogLevel level,
                 const char* file, int line, const char* function, std::string_view format,
                 std::initializer_list<SXFormatArg> args) {
  const char* slash = std::strrchr(file, '/');
  std::string text = SXFormat("%s:%d:%s: ", slash ? slash + 1 : file, line, function);
  text += SXFormatV(format, args);
  facility.write(scope, level, text);
}

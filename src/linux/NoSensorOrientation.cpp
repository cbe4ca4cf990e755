#include "linux/NoSensorOrientation.h"

std::string SXNoSensorOrientationService::orientationName(int32_t orientation) const {
  switch (orientation) {
    case 0:
      return "Unknown";
    case 1:
      return "Portrait";
    case 2:
      return "PortraitUpsideDown";
    case 3:
      return "LandscapeLeft";
    case 4:
      return "LandscapeRight";
    case 5:
      return "FaceUp";
    case 6:
      return "FaceDown";
    default:
      return "Orientation" + std::to_string(orientation);
  }
}

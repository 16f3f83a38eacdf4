// The built-in workings behind the layout functions.
#pragma once

#include <vector>

#include <kestrel/orthoutils.h>

namespace kestrel {
namespace orthoutils {

// The footprint ring of GetSceneFootprint, closed, as (x, y) pairs with z = 0.
std::vector<GDBVertex> SceneFootprint(const ogc::cs::GeocodingInfo& geocoding, unsigned int pixels,
                                      unsigned int lines, const std::vector<double>& borderX,
                                      const std::vector<double>& borderY);

}  // namespace orthoutils
}  // namespace kestrel

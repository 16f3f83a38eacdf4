// Tiled DEMs: tile indexes made by gdaltindex.
#pragma once

#include <memory>
#include <string>

#include <kestrel/dem.h>

namespace kestrel {
namespace dem {

// Whether path is a vector file whose first layer has a "location" field. False for a
// directory and for anything OGR cannot open.
bool IsTileIndex(const std::string& path);

// The mosaic of the tiles the index names. A relative tile name is taken from the index's
// directory. The datum is the index's "VERTICAL_DATUM" metadata item (layer, then file: MSL,
// ELLIPS or MATHMODEL), otherwise that of its coordinate system.
// Every tile must be a local file (no URL, no /vsi... path): DataException naming the index and
// the feature otherwise.
std::unique_ptr<IRasterDEM> OpenTileIndexDEM(const std::string& path);

// What the index says of its heights; always known (the datum the tiled DEM takes).
ogc::utils::VerticalReference TileIndexVerticalReference(const std::string& path);

}  // namespace dem
}  // namespace kestrel

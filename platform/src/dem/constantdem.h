// A DEM of one height over the area of a raster grid.
#pragma once

#include <memory>

#include <kestrel/dem.h>

namespace kestrel {
namespace dem {

// Posts every downsampling pixels of the width x height grid that crs (may be null) and
// geocoding describe, its edges included. Throws DataException for an empty grid, a null
// geocoding, a height that is not finite or a downsampling below 1.
std::unique_ptr<IRasterDEM> MakeConstantDEM(const ogc::cs::ICRS* crs,
                                            const ogc::cs::GeocodingInfo* geocoding,
                                            unsigned int width, unsigned int height,
                                            float constantHeight, ogc::cs::DatumType datum,
                                            float downsampling);

}  // namespace dem
}  // namespace kestrel

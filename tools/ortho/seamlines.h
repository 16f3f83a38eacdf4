// The mosaic's regions as an editable polygon layer: written after the mosaic as
// DIR/seamlines.gpkg, read back with --seamlines and burnt onto the common grid.
#pragma once

#include "steps.h"

#include <string>
#include <vector>

namespace ortho {

// Value k of the mosaic's source raster (and of the burnt regions) stands for scenes[k-1], the
// scenes of the mosaic; a feature's fields are the scene's name, master-file line, ortho and
// source.

// Writes the regions of the mosaic's source raster into a new GeoPackage at path: the polygon
// layer "seamlines" in the grid's CRS, one feature per connected region of one scene (its
// pixels' outline), with the fields scene, master_line, ortho and source. Pixels no scene fills
// (value 0) have no feature.
void WriteSeamlines(const std::string& sourceRaster, const std::vector<RecoveryScene>& scenes,
                    const Grid& grid, const std::string& path);

// Checks that path opens as a vector file holding the layer "seamlines" of polygons, with a
// coordinate system and the field "scene". Throws UsageError naming --seamlines.
void CheckSeamlines(const std::string& path);

// Checks that every feature of the layer names one of the scenes (names: those of the master
// file), before any scene is made. Throws UsageError naming the file, layer and feature id.
void CheckSeamlineScenes(const std::string& path, const std::vector<std::string>& names);

// Burns the layer into a GeoTIFF on the grid at raster (Byte, UInt16 from 255 scenes on): value k where the centre of a pixel
// lies in a polygon naming scenes[k-1], later features over earlier ones where polygons
// overlap, 0 where no polygon lies. Features naming another scene of the master file (one of
// others: not mosaicked in this run) are left out, their scenes' names added to skipped; a
// feature naming a scene in neither list throws.
void BurnSeamlines(const std::string& path, const std::vector<RecoveryScene>& scenes,
                   const std::vector<std::string>& others, const Grid& grid,
                   const std::string& raster, std::vector<std::string>& skipped);

}  // namespace ortho

// The ortho-process utilities: source datasets and channel groups, sensor models, the ortho
// output layout and footprint, and metadata transfer.
#pragma once

#include <string>
#include <vector>

#include <kestrel/crs.h>
#include <kestrel/datasources.h>
#include <kestrel/export.h>

// ---------------------------------------------------------------------------------------------
// Source datasets and channel groups

// One channel of a source dataset, as GetChanGroups reads it.
struct SrcChanInfo {
    unsigned int channel = 0;  // number in the dataset, from 1
    kestrel::datasources::DataType dataType = kestrel::datasources::DataType::Unknown;
    bool hasNoData = false;
    double noData = 0.0;
    std::string description;
};

// The channels of one data type: the source channels to read and the ortho channels they
// become, pairwise in the same order.
struct ChanGroup {
    std::vector<unsigned int> srcChans;
    std::vector<unsigned int> orthoChans;
    kestrel::datasources::DataType dataType = kestrel::datasources::DataType::Unknown;
};

// Opens a source image: sets dataset to a new raster dataset (owned by the caller) and never
// leaves it null. A path that GDAL cannot open gives a dataset whose IsValid is false (its
// GetInvalidReason tells why). width and height receive the image size (0 when not valid).
KESTREL_API void GetSrcDataset(const std::string& path, kestrel::datasources::IDataset*& dataset,
                               unsigned int& width, unsigned int& height);

// Splits a channel list into one group per data type, groups in the order of the data types'
// first channels, channels in the order given. The channels are those of dataset, or, when
// dataset is null, of the raster at path. An empty channel list means every channel of the
// dataset. Ortho channels are numbered from 1 within each group; with numberAcrossGroups true
// they are instead the channels' positions (from 1) in the whole list. infos receives one
// entry per channel of the list and groups the groups (both replaced). Throws DataException
// naming the channel and the channel count for a channel outside the dataset, and naming the
// path for a dataset that is not a valid raster dataset.
KESTREL_API void GetChanGroups(const std::string& path, const std::vector<unsigned int>& channels,
                               kestrel::datasources::IDataset* dataset,
                               std::vector<SrcChanInfo>& infos, std::vector<ChanGroup>& groups,
                               bool numberAcrossGroups);

// (end of source datasets and channel groups)

// ---------------------------------------------------------------------------------------------
// Sensor models, output layout, footprint and metadata transfer

#include <memory>

#include <kestrel/mathmodel.h>
#include <kestrel/vectorfile.h>

namespace kestrel {
namespace dem {
class IElevationSource;
class IRasterDEM;
}  // namespace dem
}  // namespace kestrel

// The sensor model of a source raster, owned by the caller. segment selects where it comes from:
// 1 the RPC coefficients (GDAL's "RPC" metadata domain: the TIFF tag, an .RPB or _RPC.TXT side
// file), 2 the ground control points (polynomial), 3 the geotransform (an image that is already
// georeferenced), 4 the frame camera of the side file IMAGE.camera.json beside it
// (docs/cameras.md); 0 or less the camera side file when there is one, else the first found of
// 1, 2, 3 in that order. The second argument is not used (it
// names no other source of a model). Throws FileNotFoundException for a missing file,
// DataException when GDAL cannot open it or it has no model of the kind asked for (naming the
// file and what was looked for), ParameterException for another segment number.
KESTREL_API kestrel::mathmodel::IMathModel* GetSrcModel(const std::string& path,
                                                        const std::string& unused, int segment);

// The layout of an ortho: where the source image falls on the ground when each ray through its
// border is intersected with the terrain. Arguments, in order:
//  1-4  not used (reserved).
//  5    border samples per image edge; 0 or less chooses (one ray every 16 pixels, 64 to 512).
//  6    alignment of the grid: "" or "PIXEL" puts its corners on whole multiples of the pixel
//       size; "EXTENT" puts its top-left corner on the traced extent's.
//  7    the output coordinate system; null chooses: the model's when it is projected, otherwise
//       the WGS 84 UTM zone of the scene's centre.
//  8, 9 pixel width and height in output units; 0 means the source's mean ground resolution
//       (the area of the traced footprint over the image's pixel count; square pixels), and a 0
//       beside a positive value takes that value. Set to the sizes used.
//  10   the terrain; its heights must be in the model's vertical datum (or DatumMathModel).
//       Null: flat terrain at the height of argument 11.
//  11   the height of the flat terrain when there is no DEM, in the model's datum.
//  12   the source raster; used for the model when argument 13 is null (GetSrcModel(path, "",
//       0)), and checked against the model's image size.
//  13   the source's sensor model.
//  14   the source channels of the ortho; each must exist in the source raster when it is given.
//  15, 16 out: the output coordinate system and geocoding (new, owned by the caller).
//  17, 18 out: the size in lines, then in pixels (whole pixels, not yet rounded to blocks).
//  19, 20 out: x and y of the traced border in the output coordinate system, an open ring in
//       image order (top edge left to right, right edge, bottom edge, left edge).
//  21, 22 out: the lowest and highest terrain heights met on the border.
// Throws a kestrel exception naming what is wrong: no model, a DEM that the border rays miss or
// that does not cover the scene, bad pixel sizes, non-finite values, a grid of more than 2^20
// pixels or lines.
KESTREL_API void GetLayoutOptions(const std::string& reserved1, const std::string& reserved2,
                                  const std::string& reserved3, const std::string& reserved4,
                                  int borderSamples, const std::string& alignment,
                                  const kestrel::ogc::cs::ICRS* mapCRS, double& pixelWidth,
                                  double& pixelHeight, const kestrel::dem::IRasterDEM* dem,
                                  float flatHeight, kestrel::datasources::IRasterDataset* dataset,
                                  const kestrel::mathmodel::IMathModel* model,
                                  const std::vector<int>& channels, kestrel::ogc::cs::ICRS*& outCRS,
                                  kestrel::ogc::cs::GeocodingInfo*& outGeocoding,
                                  unsigned int& lines, unsigned int& pixels,
                                  std::vector<double>& borderX, std::vector<double>& borderY,
                                  double& minHeight, double& maxHeight);

// The ground outline of the scene inside the pixels x lines grid of geocoding: the border ring
// (borderX, borderY, as GetLayoutOptions gives it) clipped to the grid and rid of vertices that
// lie within a tenth of a pixel of the line through their neighbours. vertices is set to a new
// array (delete[] by the caller) holding a closed ring (the last vertex repeats the first), z = 0;
// count to its length, which is also returned. Throws DataException when the outline has no
// area inside the grid or the lists differ in length.
KESTREL_API int GetSceneFootprint(const kestrel::ogc::cs::GeocodingInfo* geocoding,
                                  unsigned int pixels, unsigned int lines,
                                  const std::vector<double>& borderX,
                                  const std::vector<double>& borderY, GDBVertex*& vertices,
                                  int& count);

namespace kestrel {
namespace processes {
namespace ortho {

// What an ortho inherits from its source raster: the default-domain metadata items, each
// channel's description, colour interpretation and default-domain metadata items, and a
// no-data value. The value given at construction is the ortho's no-data value, set on every
// channel (it fills the cells that no source pixel reaches); NaN keeps each source channel's
// own no-data value instead (none when it has none).
class KESTREL_API OrthoMetadataTransfer {
  public:
    explicit OrthoMetadataTransfer(double noDataValue);
    ~OrthoMetadataTransfer();
    OrthoMetadataTransfer(const OrthoMetadataTransfer&) = default;
    OrthoMetadataTransfer& operator=(const OrthoMetadataTransfer&) = default;

    double GetNoDataValue() const { return noDataValue_; }

    // Copies from the source raster to the ortho raster (opened for update). channels lists the
    // source channel of each ortho channel (numbered from 1); empty means the same numbers.
    // Throws FileAccessException when a file cannot be opened, DataException for a channel the
    // source does not have.
    void Transfer(const std::string& sourcePath, const std::string& orthoPath,
                  const std::vector<unsigned int>& channels = {}) const;

  private:
    double noDataValue_;
};

}  // namespace ortho
}  // namespace processes

namespace orthoutils {

// What GetLayoutOptions computes, with the choices its arguments make (see there).
struct LayoutRequest {
    const ogc::cs::ICRS* outputCRS = nullptr;
    double pixelWidth = 0.0;
    double pixelHeight = 0.0;
    int borderSamples = 0;
    bool alignToPixelSize = true;
    double flatHeight = 0.0;
};

struct Layout {
    std::unique_ptr<ogc::cs::ICRS> crs;
    ogc::cs::GeocodingInfo geocoding;
    unsigned int pixels = 0;
    unsigned int lines = 0;
    double pixelWidth = 0.0;
    double pixelHeight = 0.0;
    std::vector<double> borderX;
    std::vector<double> borderY;
    double minHeight = 0.0;
    double maxHeight = 0.0;
    // The share of the image's ground (0 to 1) that the surface does not cover. A surface that
    // covers part of it gives the layout and border of the covered ground; under 2 % covered,
    // the layout is refused.
    double uncoveredShare = 0.0;
};

// The layout of the model's image over the terrain (null: flat at request.flatHeight).
KESTREL_API Layout ComputeLayout(const mathmodel::IMathModel& model,
                                 const dem::IElevationSource* terrain,
                                 const LayoutRequest& request);

// The implementation behind GetSrcModel, GetLayoutOptions and GetSceneFootprint: the built-in
// one, or one that a test installs to see the calls and their arguments.
class KESTREL_API LayoutImpl {
  public:
    virtual ~LayoutImpl();
    virtual mathmodel::IMathModel* GetSrcModel(const std::string& path, const std::string& unused,
                                               int segment) = 0;
    virtual void GetLayoutOptions(
        const std::string& reserved1, const std::string& reserved2, const std::string& reserved3,
        const std::string& reserved4, int borderSamples, const std::string& alignment,
        const ogc::cs::ICRS* mapCRS, double& pixelWidth, double& pixelHeight,
        const dem::IRasterDEM* dem, float flatHeight, datasources::IRasterDataset* dataset,
        const mathmodel::IMathModel* model, const std::vector<int>& channels,
        ogc::cs::ICRS*& outCRS, ogc::cs::GeocodingInfo*& outGeocoding, unsigned int& lines,
        unsigned int& pixels, std::vector<double>& borderX, std::vector<double>& borderY,
        double& minHeight, double& maxHeight) = 0;
    virtual int GetSceneFootprint(const ogc::cs::GeocodingInfo* geocoding, unsigned int pixels,
                                  unsigned int lines, const std::vector<double>& borderX,
                                  const std::vector<double>& borderY, GDBVertex*& vertices,
                                  int& count) = 0;

  protected:
    LayoutImpl() = default;
    LayoutImpl(const LayoutImpl&) = default;
    LayoutImpl& operator=(const LayoutImpl&) = default;
};

// The built-in implementation.
KESTREL_API std::shared_ptr<LayoutImpl> GetDefaultLayoutImplementation();
// Installs impl (null restores the built-in one) and returns the one it replaces. Not meant to
// be called while another thread uses these functions.
KESTREL_API std::shared_ptr<LayoutImpl> SetLayoutImplementation(std::shared_ptr<LayoutImpl> impl);

// Installs an implementation for its own lifetime and restores the previous one after.
class KESTREL_API ScopedLayoutImpl {
  public:
    explicit ScopedLayoutImpl(std::shared_ptr<LayoutImpl> impl);
    ~ScopedLayoutImpl();
    ScopedLayoutImpl(const ScopedLayoutImpl&) = delete;
    ScopedLayoutImpl& operator=(const ScopedLayoutImpl&) = delete;

  private:
    std::shared_ptr<LayoutImpl> previous_;
};

}  // namespace orthoutils
}  // namespace kestrel

// (end of sensor models, output layout, footprint and metadata transfer)

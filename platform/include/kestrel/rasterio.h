// Raster readers and writers on GDAL: windows and tiles of the channels of a raster file.
#pragma once

#include <iterator>
#include <memory>
#include <string>
#include <vector>

#include <kestrel/crs.h>
#include <kestrel/datasources.h>
#include <kestrel/export.h>
#include <kestrel/raster.h>

namespace kestrel {
namespace datasources {

// One channel of a reader or writer.
class KESTREL_API IChannelInfo {
  public:
    virtual ~IChannelInfo();
    IChannelInfo(const IChannelInfo&) = delete;
    IChannelInfo& operator=(const IChannelInfo&) = delete;

    // The channel's number in the file, from 1.
    virtual unsigned int GetChannel() const = 0;
    virtual DataType GetDataType() const = 0;
    // False when the channel has no no-data value.
    virtual bool GetNoDataValue(double& value) const = 0;
    virtual std::string GetDescription() const = 0;

  protected:
    IChannelInfo() = default;
};

class IRasterIterable;

// Walks the tiles of a reader or writer in order: left to right, then top to bottom. It holds
// no data; dereferencing reads the tile.
class KESTREL_API RasterIterator {
  public:
    using iterator_category = std::input_iterator_tag;
    using value_type = gobs::Raster*;
    using difference_type = long;
    using pointer = void;
    using reference = gobs::Raster*;

    RasterIterator() = default;
    RasterIterator(IRasterIterable* owner, unsigned int index) : owner_(owner), index_(index) {}

    unsigned int GetIndex() const { return index_; }
    // The tile's window in the image.
    unsigned int GetX() const;
    unsigned int GetY() const;
    unsigned int GetWidth() const;
    unsigned int GetHeight() const;

    // A new raster holding the tile (owned by the caller): IRasterIterable::GetRaster.
    gobs::Raster* operator*() const;
    RasterIterator& operator++() {
        ++index_;
        return *this;
    }
    RasterIterator operator++(int) {
        RasterIterator before = *this;
        ++index_;
        return before;
    }
    bool operator==(const RasterIterator& other) const {
        return owner_ == other.owner_ && index_ == other.index_;
    }
    bool operator!=(const RasterIterator& other) const { return !(*this == other); }

  private:
    IRasterIterable* owner_ = nullptr;
    unsigned int index_ = 0;
};

// Tile-wise access. The image is cut into tiles of GetTileWidth() x GetTileHeight() pixels from
// its top-left corner, numbered from 0 left to right, then top to bottom; the tiles of the last
// column and row are cut to the image.
class KESTREL_API IRasterIterable {
  public:
    virtual ~IRasterIterable();
    IRasterIterable(const IRasterIterable&) = delete;
    IRasterIterable& operator=(const IRasterIterable&) = delete;

    // A new raster (owned by the caller) holding tile `index` of every channel, its origin set.
    // Throws DataException when there is no such tile.
    virtual gobs::Raster* GetRaster(unsigned int index) = 0;
    // The tile that holds pixel (x, y); End() when the pixel is outside the image.
    virtual RasterIterator FindRaster(unsigned int x, unsigned int y) = 0;
    virtual RasterIterator Begin() = 0;
    virtual RasterIterator End() = 0;
    virtual unsigned int GetTileCount() const = 0;
    // Tiles of the file's own block size (the fastest to read and write).
    virtual void SetOptimalTileSize() = 0;
    // Throws DataException for a zero width or height.
    virtual void SetTileSize(unsigned int width, unsigned int height) = 0;
    virtual unsigned int GetTileWidth() const = 0;
    virtual unsigned int GetTileHeight() const = 0;
    // One entry per channel, in the order of the channel list; owned by the object.
    virtual const std::vector<IChannelInfo*>& GetChannelsInfo() const = 0;

  protected:
    IRasterIterable() = default;
};

// Reads windows of the given channels of a raster. Reads may be called from several threads;
// they are serialised on the file.
class KESTREL_API IRasterReader : public virtual IRasterIterable {
  public:
    ~IRasterReader() override;

    // A new raster (owned by the caller) with the window of width x height pixels whose
    // top-left pixel is (x, y), of every channel of the list in its order, of the common data
    // type of the channels (GetDataType). Throws DataException when the window is empty or
    // not inside the image, FileAccessException with GDAL's reason when the read fails.
    virtual gobs::Raster* ReadWindow(unsigned int x, unsigned int y, unsigned int width,
                                     unsigned int height) = 0;

    virtual std::string GetPath() const = 0;
    virtual unsigned int GetWidth() const = 0;
    virtual unsigned int GetHeight() const = 0;
    virtual unsigned int GetChannelCount() const = 0;
    // The file's channel numbers (from 1) that the reader delivers, in order.
    virtual std::vector<unsigned int> GetChannels() const = 0;
    // The type of the rasters read: the smallest GDAL type that holds every channel's values.
    virtual DataType GetDataType() const = 0;
    // Null when the file has none.
    virtual const ogc::cs::ICRS* GetCRS() const = 0;
    virtual const ogc::cs::GeocodingInfo* GetGeocoding() const = 0;
    // No-data value of the channel at position c of the list; false when it has none.
    virtual bool GetNoDataValue(unsigned int c, double& value) const = 0;

  protected:
    IRasterReader() = default;
};

// Writes a raster file. A new file is described by the setters first (size, data type, CRS,
// geocoding, no-data), then created at the first write (or by Create) and completed by Close.
//
// Until Close returns, the data goes to a temporary file beside the final one, so that a writer
// that fails or is destroyed without Close leaves nothing under the final name (and an older
// file there untouched). Close renames the temporary into place; formats that GDAL can only
// copy (COG, PNG, JPEG, ...) are first written as a GeoTIFF and copied to the format then.
// Reading from a writer reads what has been written so far.
class KESTREL_API IRasterWriter : public IRasterReader {
  public:
    ~IRasterWriter() override;

    // Setters of a new file; each throws DataException once the file has been created.
    virtual void SetSize(unsigned int width, unsigned int height) = 0;
    virtual void SetDataType(DataType type) = 0;
    // For a writer made without a channel list: the number of channels (default 1).
    virtual void SetChannelCount(unsigned int count) = 0;
    // Copied; null for none.
    virtual void SetCRS(const ogc::cs::ICRS* crs) = 0;
    virtual void SetGeocoding(const ogc::cs::GeocodingInfo& geocoding) = 0;
    // No-data value of every channel, or of the channel at position c.
    virtual void SetNoDataValue(double value) = 0;
    virtual void SetNoDataValue(unsigned int c, double value) = 0;
    virtual void SetChannelDescription(unsigned int c, const std::string& text) = 0;
    virtual void SetMetadataItem(const std::string& name, const std::string& value,
                                 const std::string& domain = "") = 0;

    // Creates the (temporary) file now. Throws DataException when the size or data type is not
    // set, FileAccessException naming the file and GDAL's reason when GDAL cannot create it.
    virtual void Create() = 0;
    // Writes the channels of raster at (x, y) of the image; the raster must have the writer's
    // channel count and fit inside the image. Its data type is converted when it differs.
    virtual void WriteWindow(const gobs::Raster& raster, unsigned int x, unsigned int y) = 0;
    // Writes a raster at its own origin (GetX, GetY): a tile got from GetRaster, filled in.
    virtual void Write(const gobs::Raster& raster) = 0;
    // Completes the file and puts it under its final name. Throws FileAccessException (and
    // removes the temporary) when that fails. Calls after the first do nothing.
    virtual void Close() = 0;
    virtual bool IsClosed() const = 0;

  protected:
    IRasterWriter() = default;
};

// A reader on a raster file or on an open dataset.
class KESTREL_API BasicReader : public IRasterReader {
  public:
    // Every channel of the file. Throws FileNotFoundException when nothing is at the path,
    // FileAccessException with GDAL's reason when GDAL cannot read it.
    explicit BasicReader(const std::string& path);
    // The channels of an open dataset, in the order given (empty: every channel). When
    // takeOwnership is true the reader deletes the dataset; with false the caller keeps it and
    // must keep it alive as long as the reader. Throws DataException for a channel outside the
    // dataset or an invalid dataset.
    BasicReader(IDataset* dataset, const std::vector<unsigned int>& channels, bool takeOwnership);
    ~BasicReader() override;

    gobs::Raster* GetRaster(unsigned int index) override;
    RasterIterator FindRaster(unsigned int x, unsigned int y) override;
    RasterIterator Begin() override;
    RasterIterator End() override;
    unsigned int GetTileCount() const override;
    void SetOptimalTileSize() override;
    void SetTileSize(unsigned int width, unsigned int height) override;
    unsigned int GetTileWidth() const override;
    unsigned int GetTileHeight() const override;
    const std::vector<IChannelInfo*>& GetChannelsInfo() const override;

    gobs::Raster* ReadWindow(unsigned int x, unsigned int y, unsigned int width,
                             unsigned int height) override;
    std::string GetPath() const override;
    unsigned int GetWidth() const override;
    unsigned int GetHeight() const override;
    unsigned int GetChannelCount() const override;
    std::vector<unsigned int> GetChannels() const override;
    DataType GetDataType() const override;
    const ogc::cs::ICRS* GetCRS() const override;
    const ogc::cs::GeocodingInfo* GetGeocoding() const override;
    bool GetNoDataValue(unsigned int c, double& value) const override;

    struct Impl;

  private:
    std::unique_ptr<Impl> impl_;
};

// A writer on a raster file.
class KESTREL_API BasicWriter : public IRasterWriter {
  public:
    // An existing file GDAL can update is opened for update and written in place (Close has
    // nothing to rename); otherwise a new file whose format follows the extension (see
    // core::FType2FormatName; GeoTIFF when there is none), described by the setters.
    explicit BasicWriter(const std::string& path);
    // A new file of the GDAL format `format` (a driver short name) with one channel per entry
    // of channels (the entries are the source channel numbers they hold, kept as the
    // channels' numbers in the file's order; any list of the right length will do).
    // `options` are GDAL creation options "NAME=VALUE" separated by commas or blanks, added to
    // and overriding the defaults (GeoTIFF: tiled 256 x 256, DEFLATE compressed, BigTIFF when
    // needed); empty for the defaults. Throws ParameterException (type 1) naming the format
    // when GDAL has no such raster driver or it can neither create nor copy.
    BasicWriter(const std::string& path, const std::vector<unsigned int>& channels,
                const std::string& format, const std::string& options);
    // Without Close, removes the temporary and leaves the final name as it was.
    ~BasicWriter() override;

    gobs::Raster* GetRaster(unsigned int index) override;
    RasterIterator FindRaster(unsigned int x, unsigned int y) override;
    RasterIterator Begin() override;
    RasterIterator End() override;
    unsigned int GetTileCount() const override;
    void SetOptimalTileSize() override;
    void SetTileSize(unsigned int width, unsigned int height) override;
    unsigned int GetTileWidth() const override;
    unsigned int GetTileHeight() const override;
    const std::vector<IChannelInfo*>& GetChannelsInfo() const override;

    gobs::Raster* ReadWindow(unsigned int x, unsigned int y, unsigned int width,
                             unsigned int height) override;
    std::string GetPath() const override;
    unsigned int GetWidth() const override;
    unsigned int GetHeight() const override;
    unsigned int GetChannelCount() const override;
    std::vector<unsigned int> GetChannels() const override;
    DataType GetDataType() const override;
    const ogc::cs::ICRS* GetCRS() const override;
    const ogc::cs::GeocodingInfo* GetGeocoding() const override;
    bool GetNoDataValue(unsigned int c, double& value) const override;

    void SetSize(unsigned int width, unsigned int height) override;
    void SetDataType(DataType type) override;
    void SetChannelCount(unsigned int count) override;
    void SetCRS(const ogc::cs::ICRS* crs) override;
    void SetGeocoding(const ogc::cs::GeocodingInfo& geocoding) override;
    void SetNoDataValue(double value) override;
    void SetNoDataValue(unsigned int c, double value) override;
    void SetChannelDescription(unsigned int c, const std::string& text) override;
    void SetMetadataItem(const std::string& name, const std::string& value,
                         const std::string& domain = "") override;
    void Create() override;
    void WriteWindow(const gobs::Raster& raster, unsigned int x, unsigned int y) override;
    void Write(const gobs::Raster& raster) override;
    void Close() override;
    bool IsClosed() const override;

    // The GDAL driver the file is written with.
    std::string GetFormatName() const;

    struct Impl;

  private:
    std::unique_ptr<Impl> impl_;
};

// Puts a finished dataset under its final name with all its files: every file GDAL lists for
// the dataset at `temporary` (side files such as .aux.xml, .hdr, .wld, .ovr; the path alone
// when GDAL does not open it) is renamed to `final` with the same ending. The side files go
// first and the main file last; the files of an older dataset under the final names step aside
// first and are removed at the end (the older main file first: its name never shows it with
// new side files). A single file replaces a single file in one step. When a rename fails, the
// older dataset is put back, the temporaries are removed, and FileAccessException names the
// final path and the rename that failed.
KESTREL_API void PublishDataset(const std::string& temporary, const std::string& final);

// What the raster components were asked to do, for tests that must see the arguments a caller
// passes. Nothing is observed unless an observer is installed; observers are told after the
// fact and change nothing. Notifications may come from any thread.
class KESTREL_API RasterIOObserver {
  public:
    virtual ~RasterIOObserver();
    virtual void ReaderCreated(const IRasterReader* /*reader*/, const std::string& /*path*/,
                               const std::vector<unsigned int>& /*channels*/) {}
    virtual void WindowRead(const IRasterReader* /*reader*/, unsigned int /*x*/, unsigned int /*y*/,
                            unsigned int /*width*/, unsigned int /*height*/,
                            const gobs::Raster* /*result*/) {}
    virtual void WriterCreated(const IRasterWriter* /*writer*/, const std::string& /*path*/,
                               const std::vector<unsigned int>& /*channels*/,
                               const std::string& /*format*/, const std::string& /*options*/) {}
    virtual void FormatNameLookedUp(const std::string& /*fileType*/,
                                    const std::string& /*formatName*/) {}
    // A raster object is being destroyed.
    virtual void RasterDeleted(const gobs::Raster* /*raster*/) {}

    // Installs an observer (null: none) and returns the one it replaces.
    static std::shared_ptr<RasterIOObserver> Install(std::shared_ptr<RasterIOObserver> observer);
    // The installed observer, or null.
    static std::shared_ptr<RasterIOObserver> Current();
};

// Installs an observer for its own lifetime and restores the previous one after.
class KESTREL_API ScopedRasterIOObserver {
  public:
    explicit ScopedRasterIOObserver(std::shared_ptr<RasterIOObserver> observer);
    ~ScopedRasterIOObserver();
    ScopedRasterIOObserver(const ScopedRasterIOObserver&) = delete;
    ScopedRasterIOObserver& operator=(const ScopedRasterIOObserver&) = delete;

  private:
    std::shared_ptr<RasterIOObserver> previous_;
};

}  // namespace datasources
}  // namespace kestrel

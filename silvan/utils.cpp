#include <silvan/utils.h>

#include <memory>

#include <kestrel/stringlist.h>

// ---------------------------------------------------------------------------------------------
// Elevation sources and vertical datums

#include <cctype>

#include <kestrel/exception.h>
#include <kestrel/file.h>

using kestrel::ogc::cs::DatumType;

namespace {

// The datum a new elevation source delivers its heights in: the math model's when that is its
// own, otherwise the one asked for.
DatumType OutputDatum(DatumType sourceDatum, DatumType requested) {
    return sourceDatum == kestrel::ogc::cs::DatumMathModel ? kestrel::ogc::cs::DatumMathModel
                                                            : requested;
}

std::string UpperCase(const std::string& text) {
    std::string upper = text;
    for (char& c : upper)
        c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
    return upper;
}

}  // namespace

kestrel::dem::IRasterDEM* GetDem(const std::string& demPath, int band, double offset,
                                 double scale, float noData, DatumType& demDatum,
                                 DatumType outDatum) {
    using kestrel::dem::DEMFactory;
    if (demPath.empty()) {
        KESTREL_THROW(kestrel::ParameterException, "sFileDem",
                      kestrel::ParameterException::EmptyValue, "empty",
                      "a disk file or directory", "empty dem path");
    }
    std::unique_ptr<kestrel::dem::IRasterDEM> dem;
    if (DEMFactory::IsTileRasterDEMFile(demPath)) {
        dem.reset(DEMFactory::CreateTileRasterDEM(demPath));
        demDatum = dem->GetOutputVerticalDatum();
    } else if (IsFile(demPath)) {
        dem.reset(DEMFactory::CreateFileRasterDEM(demPath, static_cast<unsigned int>(band),
                                                  offset, scale, noData, demDatum, false, 10));
    } else {
        KESTREL_THROW(kestrel::FileNotFoundException, demPath,
                      "The given filedem parameter doesn't correspond to an existing file or "
                      "directory name");
    }
    dem->SetOutputVerticalDatum(OutputDatum(demDatum, outDatum));
    return dem.release();
}

kestrel::dem::IRasterDEM* GetConstantDem(const kestrel::ogc::cs::ICRS* crs,
                                         const kestrel::ogc::cs::GeocodingInfo* geocoding,
                                         unsigned int lines, unsigned int pixels, double height,
                                         DatumType demDatum, DatumType outDatum) {
    std::unique_ptr<kestrel::dem::IRasterDEM> dem(
        kestrel::dem::DEMFactory::CreateConstantDEMDownsampled(
            crs, geocoding, pixels, lines, static_cast<float>(height), demDatum, 128.0f));
    dem->SetOutputVerticalDatum(OutputDatum(demDatum, outDatum));
    return dem.release();
}

kestrel::tin::TinReader* GetDbm(const std::string& dbmPath, int layer, double offset,
                                double scale, DatumType dbmDatum, DatumType outDatum) {
    if (dbmPath.empty())
        return nullptr;
    std::unique_ptr<kestrel::tin::TinReader> reader(kestrel::tin::TinReaderFactory::CreateTinReader(
        dbmPath.c_str(), layer, offset, scale, dbmDatum));
    if (!reader)
        return nullptr;
    reader->SetOutputVerticalDatum(OutputDatum(dbmDatum, outDatum));
    return reader.release();
}

DatumType GetVertDatum(const std::string& keyword) {
    if (keyword.empty())
        return kestrel::ogc::cs::DatumMSL;
    const std::string upper = UpperCase(keyword);
    if (upper == "MSL")
        return kestrel::ogc::cs::DatumMSL;
    if (upper == "ELLIPS" || (upper.size() >= 3 && upper.compare(0, 3, "ELL") == 0))
        return kestrel::ogc::cs::DatumEllipsoid;
    if (upper == "MATHMODEL")
        return kestrel::ogc::cs::DatumMathModel;
    KESTREL_THROW(kestrel::DataException,
                  kestrel::FormatString("Unrecognized value for -elevref: permissible values are "
                                        "MSL, ELLIPS or MATHMODEL; a value of %s was entered",
                                        keyword.c_str()));
}

DatumType GetModelDatum(const kestrel::mathmodel::IMathModel* model) {
    if (model == nullptr)
        return kestrel::ogc::cs::DatumEllipsoid;
    return kestrel::ogc::utils::GetVerticalDatumType(model->GetCRS());
}

void GetElFactor(const std::vector<float>& factors, double& offset, double& scale) {
    offset = 0.0;
    scale = 1.0;
    if (factors.empty())
        return;
    if (factors.size() > 2) {
        KESTREL_THROW(kestrel::DataException,
                      kestrel::FormatString("Invalid -elfactor argument: only 2 elements are "
                                            "allowed, but %d were passed",
                                            static_cast<int>(factors.size())));
    }
    offset = static_cast<double>(factors[0]);
    if (factors.size() == 2) {
        scale = static_cast<double>(factors[1]);
        if (scale <= 0.0) {
            KESTREL_THROW(kestrel::DataException,
                          kestrel::FormatString("Invalid -elfactor argument: the scale parameter "
                                                "must be positive.  A value of %lf was passed",
                                                scale));
        }
    }
}

void GetElUnits(const std::string& units, double& scale) {
    scale *= kestrel::dem::GetScale(UpperCase(units));
}

// (end of elevation sources and vertical datums)

// ---------------------------------------------------------------------------------------------
// Raster access and resampling

#include <sys/stat.h>

#include <kestrel/exception.h>
#include <kestrel/formats.h>
#include <kestrel/orthoutils.h>

using kestrel::datasources::BasicReader;
using kestrel::datasources::BasicWriter;
using kestrel::datasources::IDataset;
using kestrel::datasources::IRasterReader;
using kestrel::datasources::IRasterWriter;

namespace {

// Reads the reader's first pixel, so that a reader that cannot read fails here.
void ProbeReader(IRasterReader& reader) {
    std::unique_ptr<kestrel::gobs::Raster> probe(reader.ReadWindow(0, 0, 1, 1));
}

}  // namespace

IDataset* GetRasterDataset(const std::string& path) {
    IDataset* dataset = nullptr;
    unsigned int first = 0;
    unsigned int second = 0;
    GetSrcDataset(path, dataset, first, second);
    std::unique_ptr<IDataset> owned(dataset);
    if (!owned->IsValid())
        KESTREL_THROW(kestrel::FileNotFoundException, path, "");
    return owned.release();
}

IRasterReader* GetRasterReader(const std::string& path) {
    std::unique_ptr<BasicReader> reader(new BasicReader(path));
    if (reader == nullptr) {
        KESTREL_THROW(kestrel::DataException,
                      kestrel::FormatString("Could not instantiate a raster reader from file: %s",
                                            path.c_str()));
    }
    ProbeReader(*reader);
    return reader.release();
}

IRasterReader* GetRasterReader(IDataset* dataset, const std::vector<unsigned int>& channels) {
    std::unique_ptr<BasicReader> reader(new BasicReader(dataset, channels, false));
    if (reader == nullptr) {
        KESTREL_THROW(kestrel::DataException,
                      kestrel::FormatString("Could not instantiate a raster reader from dataset"));
    }
    ProbeReader(*reader);
    return reader.release();
}

IRasterWriter* GetRasterWriter(const std::string& path) {
    std::unique_ptr<BasicWriter> writer(new BasicWriter(path));
    if (writer == nullptr) {
        KESTREL_THROW(kestrel::DataException,
                      kestrel::FormatString("Could not instantiate a raster writer from file: %s",
                                            path.c_str()));
    }
    return writer.release();
}

IRasterWriter* GetRasterWriter(const std::string& path, const std::string& fileType,
                               const std::vector<unsigned int>& channels) {
    const std::string formatName = kestrel::core::FType2FormatName(fileType);
    std::unique_ptr<BasicWriter> writer(new BasicWriter(path, channels, formatName, ""));
    if (writer == nullptr) {
        KESTREL_THROW(kestrel::DataException,
                      kestrel::FormatString("Could not instantiate a raster writer from file: %s",
                                            path.c_str()));
    }
    return writer.release();
}

void GetSrcOrthoChans(IDataset* dataset, std::vector<unsigned int> channels,
                      std::vector<unsigned int>& srcChans, std::vector<unsigned int>& orthoChans) {
    std::vector<SrcChanInfo> infos;
    std::vector<ChanGroup> groups;
    GetChanGroups("", channels, dataset, infos, groups, false);
    if (groups.size() > 1) {
        KESTREL_THROW(kestrel::DataException,
                      kestrel::FormatString("All channels must belong to the same datatype, but "
                                            "%d data types are found.",
                                            static_cast<int>(groups.size())));
    }
    srcChans = groups.front().srcChans;
    orthoChans = groups.front().orthoChans;
}

kestrel::utils::IRasterResampler* GetResampler(std::string& method) {
    const kestrel::utils::ResamplerFactory factory;
    kestrel::utils::IRasterResampler* resampler = factory.GetResampler(method);
    if (resampler == nullptr) {
        KESTREL_THROW(kestrel::ParameterException, method, kestrel::ParameterException::Unsupported,
                      "", "", "Unsupported resampling method.");
    }
    return resampler;
}

unsigned int GetDiskId(const std::string& path) {
    struct stat record {};
    if (stat(path.c_str(), &record) != 0)
        return 0;
    return static_cast<unsigned int>(record.st_dev);
}

// (end of raster access and resampling)

// ---------------------------------------------------------------------------------------------
// Ortho output layout and metadata

// (end of ortho output layout and metadata)

// ---------------------------------------------------------------------------------------------
// Footprint vector output

// (end of footprint vector output)

// ---------------------------------------------------------------------------------------------
// String helpers

std::vector<std::string> TokenizeStr(const std::string& text, const char* delimiters) {
    std::vector<std::string> tokens;
    const std::unique_ptr<char*[], void (*)(char**)> list(TokenizeDelim(text.c_str(), delimiters),
                                                          &DestroyStringList);
    const int count = CountStringList(list.get());
    tokens.reserve(static_cast<std::size_t>(count));
    for (int i = 0; i < count; ++i)
        tokens.push_back(TrimWhitespace(std::string(list[i])));
    return tokens;
}

// ---------------------------------------------------------------------------------------------
// Geometry

ConvexHull2D_DnC::ConvexHull2D_DnC() = default;
ConvexHull2D_DnC::ConvexHull2D_DnC(const ConvexHull2D_DnC&) = default;
ConvexHull2D_DnC::~ConvexHull2D_DnC() = default;
ConvexHull2D_DnC& ConvexHull2D_DnC::operator=(const ConvexHull2D_DnC&) {
    return *this;
}

#include <silvan/utils.h>

#include <memory>

#include <kestrel/stringlist.h>

// ---------------------------------------------------------------------------------------------
// Elevation sources and vertical datums

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

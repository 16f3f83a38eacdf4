// GetSrcModel, GetLayoutOptions and GetSceneFootprint: the installable implementation behind
// them and the built-in one.
#include <cmath>
#include <memory>
#include <utility>

#include <kestrel/dem.h>
#include <kestrel/elevation.h>
#include <kestrel/exception.h>
#include <kestrel/orthoutils.h>

#include "../factoryslot.h"
#include "../mathmodel/models.h"
#include "layoutinternal.h"

namespace kestrel {
namespace orthoutils {

LayoutImpl::~LayoutImpl() = default;

namespace {

class BuiltInLayout final : public LayoutImpl {
  public:
    mathmodel::IMathModel* GetSrcModel(const std::string& path, const std::string&,
                                       int segment) override {
        return mathmodel::OpenSourceModel(path, segment).release();
    }

    void GetLayoutOptions(const std::string&, const std::string&, const std::string&,
                          const std::string&, int borderSamples, const std::string& alignment,
                          const ogc::cs::ICRS* mapCRS, double& pixelWidth, double& pixelHeight,
                          const dem::IRasterDEM* dem, float flatHeight,
                          datasources::IRasterDataset* dataset, const mathmodel::IMathModel* model,
                          const std::vector<int>& channels, ogc::cs::ICRS*& outCRS,
                          ogc::cs::GeocodingInfo*& outGeocoding, unsigned int& lines,
                          unsigned int& pixels, std::vector<double>& borderX,
                          std::vector<double>& borderY, double& minHeight,
                          double& maxHeight) override {
        LayoutRequest request;
        if (alignment.empty() || alignment == "PIXEL") {
            request.alignToPixelSize = true;
        } else if (alignment == "EXTENT") {
            request.alignToPixelSize = false;
        } else {
            KESTREL_THROW(ParameterException, "alignment", ParameterException::Unsupported,
                          alignment, "\"\", \"PIXEL\" or \"EXTENT\"",
                          FormatString("Unknown grid alignment \"%s\"", alignment.c_str()));
        }
        request.outputCRS = mapCRS;
        request.pixelWidth = pixelWidth;
        request.pixelHeight = pixelHeight;
        request.borderSamples = borderSamples;
        request.flatHeight = flatHeight;

        std::unique_ptr<mathmodel::IMathModel> ownModel;
        if (model == nullptr) {
            if (dataset == nullptr) {
                KESTREL_THROW(DataException,
                              "The ortho layout needs a math model or a source raster: both "
                              "are null");
            }
            ownModel = mathmodel::OpenSourceModel(dataset->GetPath(), 0);
            model = ownModel.get();
        }
        if (dataset != nullptr) {
            if (dataset->GetWidth() != model->GetImageWidth() ||
                dataset->GetHeight() != model->GetImageHeight()) {
                KESTREL_THROW(DataException,
                              FormatString("The source raster \"%s\" has %u x %u pixels, its "
                                           "math model %u x %u",
                                           dataset->GetPath().c_str(), dataset->GetWidth(),
                                           dataset->GetHeight(), model->GetImageWidth(),
                                           model->GetImageHeight()));
            }
            for (int channel : channels) {
                if (channel < 1 ||
                    static_cast<unsigned int>(channel) > dataset->GetChannelCount()) {
                    KESTREL_THROW(DataException,
                                  FormatString("The source raster \"%s\" has no channel %d (it "
                                               "has %u)",
                                               dataset->GetPath().c_str(), channel,
                                               dataset->GetChannelCount()));
                }
            }
        }
        Layout layout = ComputeLayout(*model, dem, request);
        auto geocoding = std::make_unique<ogc::cs::GeocodingInfo>(layout.geocoding);
        pixelWidth = layout.pixelWidth;
        pixelHeight = layout.pixelHeight;
        lines = layout.lines;
        pixels = layout.pixels;
        borderX = std::move(layout.borderX);
        borderY = std::move(layout.borderY);
        minHeight = layout.minHeight;
        maxHeight = layout.maxHeight;
        outGeocoding = geocoding.release();
        outCRS = layout.crs.release();
    }

    int GetSceneFootprint(const ogc::cs::GeocodingInfo* geocoding, unsigned int pixels,
                          unsigned int lines, const std::vector<double>& borderX,
                          const std::vector<double>& borderY, GDBVertex*& vertices,
                          int& count) override {
        if (geocoding == nullptr)
            KESTREL_THROW(DataException, "The scene footprint needs the output geocoding");
        const std::vector<GDBVertex> ring =
            SceneFootprint(*geocoding, pixels, lines, borderX, borderY);
        std::unique_ptr<GDBVertex[]> array(new GDBVertex[ring.size()]);
        std::copy(ring.begin(), ring.end(), array.get());
        count = static_cast<int>(ring.size());
        vertices = array.release();
        return count;
    }
};

FactorySlot<LayoutImpl>& Slot() {
    static FactorySlot<LayoutImpl> slot(std::make_shared<BuiltInLayout>());
    return slot;
}

std::shared_ptr<LayoutImpl> Current() {
    return Slot().Current();
}

}  // namespace

std::shared_ptr<LayoutImpl> GetDefaultLayoutImplementation() {
    return Slot().BuiltIn();
}

std::shared_ptr<LayoutImpl> SetLayoutImplementation(std::shared_ptr<LayoutImpl> impl) {
    return Slot().Install(std::move(impl));
}

ScopedLayoutImpl::ScopedLayoutImpl(std::shared_ptr<LayoutImpl> impl)
    : previous_(SetLayoutImplementation(std::move(impl))) {}

ScopedLayoutImpl::~ScopedLayoutImpl() {
    SetLayoutImplementation(std::move(previous_));
}

}  // namespace orthoutils
}  // namespace kestrel

using kestrel::orthoutils::Current;

kestrel::mathmodel::IMathModel* GetSrcModel(const std::string& path, const std::string& unused,
                                            int segment) {
    return Current()->GetSrcModel(path, unused, segment);
}

void GetLayoutOptions(const std::string& reserved1, const std::string& reserved2,
                      const std::string& reserved3, const std::string& reserved4, int borderSamples,
                      const std::string& alignment, const kestrel::ogc::cs::ICRS* mapCRS,
                      double& pixelWidth, double& pixelHeight, const kestrel::dem::IRasterDEM* dem,
                      float flatHeight, kestrel::datasources::IRasterDataset* dataset,
                      const kestrel::mathmodel::IMathModel* model, const std::vector<int>& channels,
                      kestrel::ogc::cs::ICRS*& outCRS,
                      kestrel::ogc::cs::GeocodingInfo*& outGeocoding, unsigned int& lines,
                      unsigned int& pixels, std::vector<double>& borderX,
                      std::vector<double>& borderY, double& minHeight, double& maxHeight) {
    Current()->GetLayoutOptions(reserved1, reserved2, reserved3, reserved4, borderSamples,
                                alignment, mapCRS, pixelWidth, pixelHeight, dem, flatHeight,
                                dataset, model, channels, outCRS, outGeocoding, lines, pixels,
                                borderX, borderY, minHeight, maxHeight);
}

int GetSceneFootprint(const kestrel::ogc::cs::GeocodingInfo* geocoding, unsigned int pixels,
                      unsigned int lines, const std::vector<double>& borderX,
                      const std::vector<double>& borderY, GDBVertex*& vertices, int& count) {
    return Current()->GetSceneFootprint(geocoding, pixels, lines, borderX, borderY, vertices,
                                        count);
}

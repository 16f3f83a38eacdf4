// The elevation functions of the utility group: the -elevref, -elfactor and unit rules, and the
// arguments, order and output datum with which they call the DEM and TIN factories.
#include <silvan/utils.h>

#include "support.h"

#include <kestrel/file.h>

#include <memory>
#include <sstream>

using kestrel::DataException;
using namespace kestrel::ogc::cs;
using namespace kestrel::dem;
using namespace kestrel::tin;
using Calls = std::vector<std::string>;

namespace {

template <class... A>
std::string Call(const std::string& name, A... args) {
    std::ostringstream out;
    out << name << "(";
    ((out << (out.str().back() == '(' ? "" : ", ") << args), ...);
    out << ")";
    return out.str();
}

// An elevation source that only records the output datum set on it.
template <class Base>
class FakeSource : public Base {
  public:
    explicit FakeSource(DatumType own) : own_(own), output_(own) {}
    void SetOutputVerticalDatum(DatumType d) override { output_ = d; }
    DatumType GetOutputVerticalDatum() const override { return output_; }
    DatumType GetVerticalDatum() const override { return own_; }
    const ICRS* GetCRS() const override { return nullptr; }
    void GetExtent(double&, double&, double&, double&) const override {}
    void SetInputCRS(const ICRS*) override {}
    void GetHeights(std::size_t, const double*, const double*, double*) const override {}

  private:
    DatumType own_, output_;
};

class FakeDEM : public FakeSource<IRasterDEM> {
  public:
    using FakeSource::FakeSource;
    unsigned int GetWidth() const override { return 0; }
    unsigned int GetHeight() const override { return 0; }
    const GeocodingInfo* GetGeocoding() const override { return nullptr; }
};

class FakeTin : public FakeSource<TinReader> {
  public:
    using FakeSource::FakeSource;
    std::size_t GetTriangleCount() const override { return 0; }
};

class RecordingDEMFactory : public DEMFactoryImpl {
  public:
    Calls calls;
    bool tiled = false;
    DatumType tiledDatum = DatumMSL;

    bool IsTileRasterDEMFile(const std::string& path) override {
        calls.push_back(Call("IsTileRasterDEMFile", path));
        return tiled;
    }
    IRasterDEM* CreateTileRasterDEM(const std::string& path) override {
        calls.push_back(Call("CreateTileRasterDEM", path));
        return new FakeDEM(tiledDatum);
    }
    IRasterDEM* CreateFileRasterDEM(const std::string& path, unsigned int band, double offset,
                                    double scale, float noData, DatumType datum, bool preload,
                                    int cache) override {
        calls.push_back(Call("CreateFileRasterDEM", path, band, offset, scale, noData,
                             static_cast<int>(datum), preload, cache));
        return new FakeDEM(datum);
    }
    IRasterDEM* CreateConstantDEMDownsampled(const ICRS* crs, const GeocodingInfo* geocoding,
                                             unsigned int width, unsigned int height, float h,
                                             DatumType datum, float downsampling) override {
        calls.push_back(Call("CreateConstantDEMDownsampled", crs != nullptr, geocoding != nullptr,
                             width, height, h, static_cast<int>(datum), downsampling));
        return new FakeDEM(datum);
    }
};

class RecordingTinFactory : public TinReaderFactoryImpl {
  public:
    Calls calls;
    bool fail = false;
    TinReader* CreateTinReader(const char* path, int layer, double offset, double scale,
                               DatumType datum) override {
        calls.push_back(
            Call("CreateTinReader", path, layer, offset, scale, static_cast<int>(datum)));
        return fail ? nullptr : new FakeTin(datum);
    }
};

class Factories : public ::testing::Test {
  protected:
    Factories()
        : dems(std::make_shared<RecordingDEMFactory>()),
          tins(std::make_shared<RecordingTinFactory>()),
          demScope(dems),
          tinScope(tins) {}

    std::shared_ptr<RecordingDEMFactory> dems;
    std::shared_ptr<RecordingTinFactory> tins;
    ScopedDEMFactoryImpl demScope;
    ScopedTinReaderFactoryImpl tinScope;
    testsupport::TempDir dir;
};

// A math model that reports a coordinate system.
class Model : public kestrel::mathmodel::IMathModel {
  public:
    explicit Model(const std::string& crs) : crs_(crs) {}
    const ICRS* GetCRS() const override { return &crs_; }
    unsigned int GetImageWidth() const override { return 0; }
    unsigned int GetImageHeight() const override { return 0; }
    void GroundToImage(std::size_t, const double*, const double*, const double*, double*, double*,
                       bool*) const override {}
    void ImageToGround(std::size_t, const double*, const double*, const double*, double*, double*,
                       bool*) const override {}

  private:
    ICRS crs_;
};

std::string MessageOf(const std::function<void()>& f) {
    try {
        f();
    } catch (const DataException& e) {
        EXPECT_EQ(e.GetSourceFile(), "utils.cpp");
        return e.what();
    }
    return "(no exception)";
}

}  // namespace

TEST(VertDatum, KeywordsInAnyCaseAndTheirPrefixOthersNamedAsGiven) {
    const std::pair<const char*, DatumType> cases[] = {
        {"", DatumMSL},
        {"MSL", DatumMSL},
        {"mSl", DatumMSL},
        {"ELL", DatumEllipsoid},
        {"ellips", DatumEllipsoid},
        {"Ellipsoid", DatumEllipsoid},
        {"ellxyz", DatumEllipsoid},
        {"MATHMODEL", DatumMathModel},
        {"MathModel", DatumMathModel},
    };
    for (const auto& c : cases)
        EXPECT_EQ(GetVertDatum(c.first), c.second) << c.first;
    // Other texts are named as given.
    for (const char* text : {" MSL", "MSL ", "EL", "geoid", "mathmodel2"}) {
        EXPECT_EQ(MessageOf([&] { GetVertDatum(text); }),
                  std::string("Unrecognized value for -elevref: permissible values are MSL, "
                              "ELLIPS or MATHMODEL; a value of ") +
                      text + " was entered");
    }
}

TEST(ModelDatum, FromTheModelsCoordinateSystem) {
    EXPECT_EQ(GetModelDatum(nullptr), DatumEllipsoid);
    EXPECT_EQ(GetModelDatum(std::make_unique<Model>("EPSG:32632+5773").get()), DatumMSL);
    EXPECT_EQ(GetModelDatum(std::make_unique<Model>("EPSG:4979").get()), DatumEllipsoid);
    EXPECT_EQ(GetModelDatum(std::make_unique<Model>("EPSG:32632").get()), DatumEllipsoid);
}

TEST(ElFactor, DefaultsOffsetAndScale) {
    struct Case {
        std::vector<float> factors;
        double offset, scale;
        std::string message;
    } cases[] = {
        {{}, 0.0, 1.0, ""},
        {{5}, 5.0, 1.0, ""},
        {{5, 2}, 5.0, 2.0, ""},
        {{5, 0},
         5.0,
         0.0,
         "Invalid -elfactor argument: the scale parameter must be positive.  A value of 0.000000 "
         "was passed"},
        {{5, -1.5f},
         5.0,
         -1.5,
         "Invalid -elfactor argument: the scale parameter must be positive.  A value of "
         "-1.500000 was passed"},
        {{1, 2, 3},
         0.0,
         1.0,
         "Invalid -elfactor argument: only 2 elements are allowed, but 3 were passed"},
    };
    for (const auto& c : cases) {
        double offset = 7, scale = 7;
        const std::string message = MessageOf([&] { GetElFactor(c.factors, offset, scale); });
        EXPECT_EQ(message, c.message.empty() ? "(no exception)" : c.message);
        EXPECT_EQ(offset, c.offset);
        EXPECT_EQ(scale, c.scale);
    }
}

TEST(ElUnits, MultipliesByTheFactorOfTheUpperCasedUnit) {
    const std::pair<const char*, double> cases[] = {
        {"m", 2.0},
        {"Metres", 2.0},
        {"feet", 2 * 0.3048},
        {"ft", 2 * 0.3048},
        {"us_foot", 2 * 1200.0 / 3937.0},
        {"ftUS", 2 * 1200.0 / 3937.0},
    };
    for (const auto& c : cases) {
        double scale = 2.0;
        GetElUnits(c.first, scale);
        EXPECT_DOUBLE_EQ(scale, c.second) << c.first;
    }
    double scale = 2.0;
    const std::string message =
        testsupport::ThrownMessage<DataException>([&] { GetElUnits("furlong", scale); });
    EXPECT_TRUE(testsupport::Contains(message, "\"FURLONG\"") &&
                testsupport::Contains(message, "METRE"))
        << message;
    EXPECT_EQ(scale, 2.0);
}

// An empty DEM path is refused before any factory call; a missing one is not found after the
// tiled test.
TEST_F(Factories, EmptyOrMissingDemPathIsRefused) {
    DatumType datum = DatumMSL;
    if (const auto e = testsupport::Thrown<kestrel::ParameterException>(
            [&] { delete GetDem("", 1, 0, 1, 0, datum, DatumEllipsoid); })) {
        EXPECT_EQ(e->GetParameterName(), "sFileDem");
        EXPECT_EQ(e->GetType(), kestrel::ParameterException::EmptyValue);
        EXPECT_EQ(e->GetValue(), "empty");
        EXPECT_EQ(e->GetExpected(), "a disk file or directory");
        EXPECT_STREQ(e->what(), "empty dem path");
        EXPECT_TRUE(testsupport::Contains(e->GetFunction(), "GetDem("));
        EXPECT_EQ(e->GetSourceFile(), "utils.cpp");
    }
    EXPECT_TRUE(dems->calls.empty());

    const std::string path = dir.File("none.tif");
    if (const auto e = testsupport::Thrown<kestrel::FileNotFoundException>(
            [&] { delete GetDem(path, 1, 0, 1, 0, datum, DatumEllipsoid); })) {
        EXPECT_EQ(e->GetFileName(), path);
        EXPECT_STREQ(e->what(),
                     "The given filedem parameter doesn't correspond to an existing "
                     "file or directory name");
    }
    EXPECT_EQ(dems->calls, Calls{Call("IsTileRasterDEMFile", path)});
}

TEST_F(Factories, FileDemGetsItsArgumentsInOrderAndTheRequestedDatum) {
    const std::string path = testsupport::WriteFile(dir.File("dem.tif"), "x");
    for (const std::string& p : {path, dir.Path().string()}) {
        dems->calls.clear();
        DatumType datum = DatumMSL;
        std::unique_ptr<IRasterDEM> dem(GetDem(p, 3, 1.5, 2.5, -9999.0f, datum, DatumEllipsoid));
        EXPECT_EQ(dems->calls,
                  (Calls{Call("IsTileRasterDEMFile", p),
                         Call("CreateFileRasterDEM", p, 3, 1.5, 2.5, -9999, 2001, false, 10)}));
        EXPECT_EQ(dem->GetOutputVerticalDatum(), DatumEllipsoid);
        EXPECT_EQ(datum, DatumMSL);
    }
    // A negative band reaches the factory converted to unsigned; a math-model DEM keeps its datum.
    dems->calls.clear();
    DatumType datum = DatumMathModel;
    std::unique_ptr<IRasterDEM> dem(GetDem(path, -1, 0, 1, 0, datum, DatumMSL));
    EXPECT_EQ(dems->calls.back(),
              Call("CreateFileRasterDEM", path, 4294967295u, 0, 1, 0, 2000, false, 10));
    EXPECT_EQ(dem->GetOutputVerticalDatum(), DatumMathModel);
}

TEST_F(Factories, TiledDemTakesItsOwnDatumWhateverIsFileSays) {
    dems->tiled = true;
    const std::string path = dir.File("not-there.gpkg");
    ASSERT_FALSE(IsFile(path));
    const std::pair<DatumType, DatumType> cases[] = {
        {DatumMathModel, DatumMathModel}, {DatumEllipsoid, DatumMSL}, {DatumMSL, DatumMSL}};
    for (const auto& c : cases) {
        dems->calls.clear();
        dems->tiledDatum = c.first;
        DatumType datum = DatumEllipsoid;
        std::unique_ptr<IRasterDEM> dem(GetDem(path, 1, 0, 1, 0, datum, DatumMSL));
        EXPECT_EQ(dems->calls,
                  (Calls{Call("IsTileRasterDEMFile", path), Call("CreateTileRasterDEM", path)}));
        EXPECT_EQ(datum, c.first);
        EXPECT_EQ(dem->GetOutputVerticalDatum(), c.second);
    }
}

TEST_F(Factories, ConstantDemSwapsItsSizesAndDownsamples128) {
    const ICRS crs("EPSG:32632");
    const GeocodingInfo geocoding = GeocodingInfo::NorthUp(500000, 5000000, 1, 1);
    std::unique_ptr<IRasterDEM> dem(
        GetConstantDem(&crs, &geocoding, 100, 200, 12.75, DatumMSL, DatumEllipsoid));
    EXPECT_EQ(dems->calls,
              Calls{Call("CreateConstantDEMDownsampled", true, true, 200, 100, 12.75, 2001, 128)});
    EXPECT_EQ(dem->GetOutputVerticalDatum(), DatumEllipsoid);
    dem.reset(GetConstantDem(&crs, &geocoding, 1, 2, 0, DatumMathModel, DatumEllipsoid));
    EXPECT_EQ(dem->GetOutputVerticalDatum(), DatumMathModel);
}

TEST_F(Factories, DbmGetsItsArgumentsAndTheOutputDatumRuleOrGivesNull) {
    const std::pair<DatumType, DatumType> cases[] = {{DatumMSL, DatumEllipsoid},
                                                     {DatumMathModel, DatumMathModel}};
    for (const auto& c : cases) {
        tins->calls.clear();
        std::unique_ptr<TinReader> tin(GetDbm("t.gpkg", 0, -2, 0.5, c.first, DatumEllipsoid));
        ASSERT_TRUE(tin);
        EXPECT_EQ(tins->calls,
                  Calls{Call("CreateTinReader", "t.gpkg", 0, -2, 0.5, static_cast<int>(c.first))});
        EXPECT_EQ(tin->GetOutputVerticalDatum(), c.second);
    }
    // Null for an empty path (no factory asked) and for a path with no TIN.
    tins->calls.clear();
    EXPECT_EQ(GetDbm("", 1, 0, 1, DatumMSL, DatumEllipsoid), nullptr);
    EXPECT_TRUE(tins->calls.empty());
    tins->fail = true;
    EXPECT_EQ(GetDbm("a.gpkg", 2, 0.5, 3, DatumMSL, DatumEllipsoid), nullptr);
    EXPECT_EQ(tins->calls, Calls{Call("CreateTinReader", "a.gpkg", 2, 0.5, 3, 2001)});
}

TEST(FactorySeams, InstallingNullRestoresTheBuiltInImplementation) {
    const auto dems = std::make_shared<RecordingDEMFactory>();
    EXPECT_EQ(DEMFactory::SetImplementation(dems), DEMFactory::GetDefaultImplementation());
    EXPECT_EQ(DEMFactory::SetImplementation(nullptr), dems);
    const auto tins = std::make_shared<RecordingTinFactory>();
    EXPECT_EQ(TinReaderFactory::SetImplementation(tins),
              TinReaderFactory::GetDefaultImplementation());
    EXPECT_EQ(TinReaderFactory::SetImplementation(nullptr), tins);
}

// Where frame cameras come from: the camera side file of an image, an exterior-orientation table
// with its interior-orientation files, and an OpenSfM reconstruction.
#include <algorithm>
#include <cmath>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include <cpl_json.h>
#include <gdal_priv.h>

#include <kestrel/exception.h>
#include <kestrel/file.h>
#include <kestrel/mathmodel.h>

#include <kestrel/gdalsupport.h>

namespace kestrel {
namespace mathmodel {

namespace {

namespace fs = std::filesystem;

CPLJSONObject LoadJson(const std::string& path) {
    gdalsupport::EnsureRegistered();
    gdalsupport::ErrorCapture errors;
    if (!fs::exists(path)) {
        KESTREL_THROW(FileNotFoundException, path,
                      FormatString("The camera file \"%s\" does not exist", path.c_str()));
    }
    CPLJSONDocument document;
    if (!document.Load(path)) {
        KESTREL_THROW(DataException, FormatString("The camera file \"%s\" is not valid JSON: %s",
                                                  path.c_str(), errors.Reason().c_str()));
    }
    return document.GetRoot();
}

bool IsNumber(const CPLJSONObject& value) {
    const auto type = value.GetType();
    return type == CPLJSONObject::Type::Double || type == CPLJSONObject::Type::Integer ||
           type == CPLJSONObject::Type::Long;
}

// A number member; a missing one is `fallback`, or an error when required.
double Number(const CPLJSONObject& object, const std::string& key, const std::string& where,
              bool required, double fallback = 0.0) {
    const CPLJSONObject value = object.GetObj(key);
    if (!value.IsValid()) {
        if (!required)
            return fallback;
        KESTREL_THROW(DataException,
                      FormatString("%s: \"%s\" is missing", where.c_str(), key.c_str()));
    }
    const double number = value.ToDouble(NAN);
    if (!IsNumber(value) || !std::isfinite(number)) {
        KESTREL_THROW(DataException, FormatString("%s: \"%s\" is not a finite number",
                                                  where.c_str(), key.c_str()));
    }
    return number;
}

unsigned int Size(const CPLJSONObject& object, const std::string& key, const std::string& where) {
    const double v = Number(object, key, where, true);
    if (v < 1 || v > 1e6 || v != std::floor(v)) {
        KESTREL_THROW(DataException, FormatString("%s: \"%s\" is %g, not a whole number of pixels",
                                                  where.c_str(), key.c_str(), v));
    }
    return static_cast<unsigned int>(v);
}

// n numbers of an array member.
std::vector<double> Numbers(const CPLJSONObject& object, const std::string& key,
                            const std::string& where, int n) {
    const CPLJSONObject value = object.GetObj(key);
    const CPLJSONArray array = value.ToArray();
    std::vector<double> numbers;
    if (value.GetType() == CPLJSONObject::Type::Array) {
        for (int i = 0; i < array.Size(); ++i) {
            const CPLJSONObject item = array[i];
            if (item.GetType() == CPLJSONObject::Type::Array) {
                const CPLJSONArray row = item.ToArray();
                for (int j = 0; j < row.Size(); ++j)
                    numbers.push_back(IsNumber(row[j]) ? row[j].ToDouble() : NAN);
            } else {
                numbers.push_back(IsNumber(item) ? item.ToDouble() : NAN);
            }
        }
    }
    if (static_cast<int>(numbers.size()) != n ||
        !std::all_of(numbers.begin(), numbers.end(), [](double v) { return std::isfinite(v); })) {
        KESTREL_THROW(DataException, FormatString("%s: \"%s\" must hold %d finite numbers",
                                                  where.c_str(), key.c_str(), n));
    }
    return numbers;
}

void CheckSize(const CameraIntrinsics& c, unsigned int width, unsigned int height,
               const std::string& where, const std::string& image) {
    if ((width != 0 || height != 0) && (c.width != width || c.height != height)) {
        KESTREL_THROW(DataException,
                      FormatString("%s: the camera of \"%s\" is %u x %u pixels, the image %u x %u",
                                   where.c_str(), image.c_str(), c.width, c.height, width,
                                   height));
    }
}

// The interior orientation of our own camera files.
CameraIntrinsics ReadIntrinsics(const CPLJSONObject& root, const std::string& where) {
    CameraIntrinsics c;
    const std::string lens = root.GetString("lens", "brown");
    if (lens == "fisheye") {
        c.lens = LensType::Fisheye;
    } else if (lens != "brown") {
        KESTREL_THROW(DataException,
                      FormatString("%s: unknown lens type \"%s\" (brown or fisheye)",
                                   where.c_str(), lens.c_str()));
    }
    c.width = Size(root, "width", where);
    c.height = Size(root, "height", where);
    c.fx = Number(root, "fx", where, true);
    c.fy = Number(root, "fy", where, true);
    c.cx = Number(root, "cx", where, true);
    c.cy = Number(root, "cy", where, true);
    c.k1 = Number(root, "k1", where, false);
    c.k2 = Number(root, "k2", where, false);
    c.k3 = Number(root, "k3", where, false);
    if (c.lens == LensType::Fisheye) {
        c.k4 = Number(root, "k4", where, false);
    } else {
        c.p1 = Number(root, "p1", where, false);
        c.p2 = Number(root, "p2", where, false);
    }
    return c;
}

std::string FileName(const std::string& path) {
    return fs::path(path).filename().string();
}

// ---------------------------------------------------------------------------------------------
// Exterior-orientation table

std::vector<std::string> Fields(const std::string& line) {
    std::string text = line;
    std::replace_if(
        text.begin(), text.end(), [](char c) { return c == ',' || c == ';' || c == '\t'; }, ' ');
    std::istringstream in(text);
    std::vector<std::string> fields;
    for (std::string f; in >> f;)
        fields.push_back(f);
    return fields;
}

bool ParseNumber(const std::string& text, double& value) {
    char* end = nullptr;
    value = std::strtod(text.c_str(), &end);
    return end != text.c_str() && *end == '\0' && std::isfinite(value);
}

std::unique_ptr<IMathModel> FromTable(const std::string& table, const std::string& image,
                                      unsigned int width, unsigned int height,
                                      const std::string& crs) {
    std::ifstream in(table);
    if (!in) {
        KESTREL_THROW(FileNotFoundException, table,
                      FormatString("The camera file \"%s\" cannot be read", table.c_str()));
    }
    const std::string name = FileName(image), stem = fs::path(image).stem().string();
    int number = 0;
    bool first = true;
    for (std::string line; std::getline(in, line);) {
        ++number;
        if (!line.empty() && line.back() == '\r')
            line.pop_back();
        const std::vector<std::string> f = Fields(line);
        if (f.empty() || f[0][0] == '#')
            continue;
        double values[6];
        bool numeric = f.size() >= 7;
        for (int i = 0; numeric && i < 6; ++i)
            numeric = ParseNumber(f[i + 1], values[i]);
        const bool header = first && !numeric;
        first = false;
        if (header)
            continue;
        const std::string where = FormatString("%s, line %d", table.c_str(), number);
        if (!numeric || f.size() > 8) {
            KESTREL_THROW(DataException,
                          FormatString("%s: expected image, X, Y, Z, omega, phi, kappa (degrees) "
                                       "and an optional interior-orientation file",
                                       where.c_str()));
        }
        if (f[0] != name && f[0] != stem)
            continue;
        if (crs.empty()) {
            KESTREL_THROW(DataException,
                          FormatString("%s: the CRS of an exterior-orientation table must be "
                                       "given (--cameras-srs)",
                                       table.c_str()));
        }
        const fs::path dir = fs::path(table).parent_path();
        const std::string io = (dir / (f.size() == 8 ? f[7] : "camera.json")).string();
        const CameraIntrinsics intrinsics = ReadIntrinsics(LoadJson(io), io);
        CheckSize(intrinsics, width, height, io, image);
        CameraPose pose;
        pose.crs = crs;
        pose.centre = {values[0], values[1], values[2]};
        pose.rotation = RotationFromOpk(values[3], values[4], values[5]);
        return MakeFrameCameraModel(intrinsics, pose, where + " (image \"" + image + "\")");
    }
    KESTREL_THROW(DataException,
                  FormatString("%s: no orientation of the image \"%s\" (looked for \"%s\" or "
                               "\"%s\")",
                               table.c_str(), image.c_str(), name.c_str(), stem.c_str()));
}

// ---------------------------------------------------------------------------------------------
// OpenSfM reconstruction

// OpenSfM's normalised image coordinates (units of the larger image side, origin at the image
// centre) turned into OpenCV's pixels.
CameraIntrinsics FromOpenSfm(const CPLJSONObject& camera, const std::string& where) {
    CameraIntrinsics c;
    c.width = Size(camera, "width", where);
    c.height = Size(camera, "height", where);
    const double scale = std::max(c.width, c.height);
    const std::string type = camera.GetString("projection_type", "perspective");
    double fx, fy, px = 0, py = 0;
    if (type == "perspective" || type == "fisheye") {
        fx = fy = Number(camera, "focal", where, true);
        c.lens = type == "fisheye" ? LensType::Fisheye : LensType::Brown;
    } else if (type == "brown" || type == "fisheye_opencv" || type == "radial" ||
               type == "simple_radial") {
        fx = Number(camera, "focal_x", where, true);
        fy = Number(camera, "focal_y", where, true);
        px = Number(camera, "c_x", where, false);
        py = Number(camera, "c_y", where, false);
        c.lens = type == "fisheye_opencv" ? LensType::Fisheye : LensType::Brown;
        c.k3 = Number(camera, "k3", where, false);
        c.k4 = type == "fisheye_opencv" ? Number(camera, "k4", where, false) : 0.0;
        c.p1 = Number(camera, "p1", where, false);
        c.p2 = Number(camera, "p2", where, false);
    } else {
        KESTREL_THROW(DataException,
                      FormatString("%s: unknown lens type \"%s\" (perspective, brown, fisheye, "
                                   "fisheye_opencv, radial or simple_radial)",
                                   where.c_str(), type.c_str()));
    }
    c.k1 = Number(camera, "k1", where, false);
    c.k2 = Number(camera, "k2", where, false);
    c.fx = fx * scale, c.fy = fy * scale;
    c.cx = px * scale + (c.width - 1) / 2.0;
    c.cy = py * scale + (c.height - 1) / 2.0;
    return c;
}

std::unique_ptr<IMathModel> FromReconstruction(const CPLJSONObject& root, const std::string& file,
                                               const std::string& image, unsigned int width,
                                               unsigned int height, const std::string& crs) {
    const std::string name = FileName(image);
    const CPLJSONArray reconstructions = root.ToArray();
    for (int r = 0; r < reconstructions.Size(); ++r) {
        const CPLJSONObject reconstruction = reconstructions[r];
        const CPLJSONObject shots = reconstruction.GetObj("shots");
        for (const CPLJSONObject& shot : shots.GetChildren()) {
            if (shot.GetName() != name)
                continue;
            const std::string where = FormatString("%s, shot \"%s\"", file.c_str(), name.c_str());
            const std::string id = shot.GetString("camera", "");
            CPLJSONObject camera;
            for (const CPLJSONObject& c : reconstruction.GetObj("cameras").GetChildren())
                if (c.GetName() == id)
                    camera = c;
            if (!camera.IsValid()) {
                KESTREL_THROW(DataException, FormatString("%s: the camera \"%s\" is not in the "
                                                          "reconstruction's cameras",
                                                          where.c_str(), id.c_str()));
            }
            const CameraIntrinsics intrinsics =
                FromOpenSfm(camera, FormatString("%s, camera \"%s\"", where.c_str(), id.c_str()));
            CheckSize(intrinsics, width, height, where, image);
            const CPLJSONObject lla = reconstruction.GetObj("reference_lla");
            const std::string origin = FormatString("%s, reference_lla", file.c_str());
            const std::vector<double> rotation = Numbers(shot, "rotation", where, 3);
            const std::vector<double> t = Numbers(shot, "translation", where, 3);
            CameraPose pose;
            pose.crs = crs.empty() ? "EPSG:4979" : crs;
            pose.frame = CameraPose::Frame::Topocentric;
            pose.origin = {Number(lla, "longitude", origin, true),
                           Number(lla, "latitude", origin, true),
                           Number(lla, "altitude", origin, true)};
            pose.rotation = RotationFromAxisAngle({rotation[0], rotation[1], rotation[2]});
            // C = -R^T t.
            const auto& m = pose.rotation;
            for (int i = 0; i < 3; ++i)
                pose.centre[i] = -(m[i] * t[0] + m[3 + i] * t[1] + m[6 + i] * t[2]);
            return MakeFrameCameraModel(intrinsics, pose,
                                        where + " (image \"" + image + "\")");
        }
    }
    KESTREL_THROW(DataException,
                  FormatString("%s: no shot of the image \"%s\" in the reconstruction",
                               file.c_str(), image.c_str()));
}

void RasterSize(const std::string& image, unsigned int& width, unsigned int& height) {
    gdalsupport::EnsureRegistered();
    gdalsupport::ErrorCapture errors;
    std::unique_ptr<GDALDataset> dataset(
        GDALDataset::Open(image.c_str(), GDAL_OF_RASTER | GDAL_OF_READONLY));
    if (!dataset) {
        KESTREL_THROW(DataException, FormatString("GDAL cannot open \"%s\" as a raster: %s",
                                                  image.c_str(), errors.Reason().c_str()));
    }
    width = static_cast<unsigned int>(dataset->GetRasterXSize());
    height = static_cast<unsigned int>(dataset->GetRasterYSize());
}

std::string Json(double v) {
    return FormatString("%.17g", v);
}

}  // namespace

std::string CameraSideFile(const std::string& imagePath) {
    return fs::path(imagePath).replace_extension(".camera.json").string();
}

std::unique_ptr<IMathModel> ReadCameraFile(const std::string& path, const std::string& imagePath) {
    unsigned int imageWidth = 0, imageHeight = 0;
    if (!imagePath.empty())
        RasterSize(imagePath, imageWidth, imageHeight);
    const CPLJSONObject root = LoadJson(path);
    if (root.GetType() != CPLJSONObject::Type::Object) {
        KESTREL_THROW(DataException,
                      FormatString("The camera file \"%s\" does not hold a JSON object",
                                   path.c_str()));
    }
    const CameraIntrinsics intrinsics = ReadIntrinsics(root, path);
    CheckSize(intrinsics, imageWidth, imageHeight, path, imagePath);
    CameraPose pose;
    pose.crs = root.GetString("crs", "");
    if (pose.crs.empty()) {
        KESTREL_THROW(DataException,
                      FormatString("%s: \"crs\" (the CRS of the centre) is missing",
                                   path.c_str()));
    }
    const std::vector<double> c = Numbers(root, "centre", path, 3);
    pose.centre = {c[0], c[1], c[2]};
    const bool hasRotation = root.GetObj("rotation").IsValid(), hasOpk = root.GetObj("opk").IsValid();
    if (hasRotation == hasOpk) {
        KESTREL_THROW(DataException,
                      FormatString("%s: give the attitude either as \"rotation\" (3 x 3, world "
                                   "to camera) or as \"opk\" (omega, phi, kappa in degrees)",
                                   path.c_str()));
    }
    if (hasRotation) {
        const std::vector<double> r = Numbers(root, "rotation", path, 9);
        std::copy(r.begin(), r.end(), pose.rotation.begin());
    } else {
        const std::vector<double> a = Numbers(root, "opk", path, 3);
        pose.rotation = RotationFromOpk(a[0], a[1], a[2]);
    }
    return MakeFrameCameraModel(intrinsics, pose, path);
}

void WriteCameraFile(const std::string& path, const CameraIntrinsics& c, const CameraPose& pose) {
    if (pose.frame != CameraPose::Frame::LocalGrid) {
        KESTREL_THROW(DataException,
                      FormatString("%s: a camera file holds a centre in its CRS and an attitude "
                                   "in the local map frame",
                                   path.c_str()));
    }
    const auto& r = pose.rotation;
    std::string text = "{\n";
    text += "  \"lens\": \"" + std::string(c.lens == LensType::Fisheye ? "fisheye" : "brown") +
            "\",\n";
    text += FormatString("  \"width\": %u,\n  \"height\": %u,\n", c.width, c.height);
    text += "  \"fx\": " + Json(c.fx) + ", \"fy\": " + Json(c.fy) + ",\n";
    text += "  \"cx\": " + Json(c.cx) + ", \"cy\": " + Json(c.cy) + ",\n";
    text += "  \"k1\": " + Json(c.k1) + ", \"k2\": " + Json(c.k2) + ", \"k3\": " + Json(c.k3);
    text += c.lens == LensType::Fisheye ? ", \"k4\": " + Json(c.k4) + ",\n"
                                        : ", \"p1\": " + Json(c.p1) + ", \"p2\": " + Json(c.p2) +
                                              ",\n";
    std::string crs;
    for (char ch : pose.crs) {
        if (ch == '"' || ch == '\\')
            crs += '\\';
        crs += ch;
    }
    text += "  \"crs\": \"" + crs + "\",\n";
    text += "  \"centre\": [" + Json(pose.centre[0]) + ", " + Json(pose.centre[1]) + ", " +
            Json(pose.centre[2]) + "],\n";
    text += "  \"rotation\": [\n";
    for (int i = 0; i < 3; ++i)
        text += "    [" + Json(r[i * 3]) + ", " + Json(r[i * 3 + 1]) + ", " + Json(r[i * 3 + 2]) +
                (i < 2 ? "],\n" : "]\n");
    text += "  ]\n}\n";
    core::fileio::ReplacingFile file(path, KESTREL_HERE, true);
    file.Write(text);
    file.Commit();
}

std::unique_ptr<IMathModel> OpenCameraModel(const std::string& imagePath,
                                            const std::string& camerasFile,
                                            const std::string& crs) {
    unsigned int width = 0, height = 0;
    RasterSize(imagePath, width, height);
    std::string start;
    {
        std::ifstream in(camerasFile);
        if (!in) {
            KESTREL_THROW(FileNotFoundException, camerasFile,
                          FormatString("The camera file \"%s\" cannot be read",
                                       camerasFile.c_str()));
        }
        in >> start;
    }
    if (!start.empty() && (start[0] == '[' || start[0] == '{')) {
        const CPLJSONObject root = LoadJson(camerasFile);
        if (root.GetType() != CPLJSONObject::Type::Array) {
            KESTREL_THROW(DataException,
                          FormatString("%s is not an OpenSfM reconstruction (a JSON list of "
                                       "reconstructions)",
                                       camerasFile.c_str()));
        }
        return FromReconstruction(root, camerasFile, imagePath, width, height, crs);
    }
    return FromTable(camerasFile, imagePath, width, height, crs);
}

}  // namespace mathmodel
}  // namespace kestrel

#include "inputs.h"

#include "summary.h"

#include <silvan/utils.h>

#include <kestrel/exception.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>
#include <system_error>

namespace fs = std::filesystem;

namespace ortho {

namespace {

// The first line of a master file written for images; a file there without it is the user's.
const char kImageMasterHeader[] =
    "!MFILE written by silvan-ortho for the images on its command line";

enum class InputKind { Missing, Directory, Image, Text, Binary };

bool HoldsNulByte(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    char buffer[4096];
    in.read(buffer, sizeof buffer);
    const std::string head(buffer, static_cast<std::size_t>(in.gcount()));
    return head.find('\0') != std::string::npos;
}

InputKind Classify(const std::string& path) {
    std::error_code ec;
    if (!fs::exists(path, ec))
        return InputKind::Missing;
    if (fs::is_directory(path, ec))
        return InputKind::Directory;
    try {
        std::unique_ptr<kestrel::datasources::IDataset> dataset(GetRasterDataset(path));
        return InputKind::Image;
    } catch (const kestrel::Exception&) {
    }
    // Parameter files are text; a NUL byte says binary data (an image GDAL cannot read).
    return HoldsNulByte(path) ? InputKind::Binary : InputKind::Text;
}

// Why a file named where images are expected is not one.
std::string NotAnImage(const std::string& path, InputKind kind) {
    switch (kind) {
        case InputKind::Missing:
            return path + ": not found";
        case InputKind::Directory:
            return path + ": a directory, not an image";
        case InputKind::Text:
            return path +
                   ": a text file (a master parameter file?), not an image: give either one "
                   "master parameter file or images";
        default:
            return path + ": not an image that GDAL can read";
    }
}

}  // namespace

void ResolveInputs(Options& options) {
    if (options.inputs.size() == 1) {
        const std::string& path = options.inputs.front();
        switch (Classify(path)) {
            case InputKind::Image:
                options.images = options.inputs;
                return;
            case InputKind::Directory:
                throw UsageError(path +
                                 ": a directory; give a master parameter file or the images");
            case InputKind::Binary:
                throw UsageError(path +
                                 ": neither an image that GDAL can read nor a master parameter "
                                 "file (it holds binary data)");
            default:
                options.master = path;
                return;
        }
    }
    for (const std::string& path : options.inputs) {
        const InputKind kind = Classify(path);
        if (kind != InputKind::Image)
            throw UsageError(NotAnImage(path, kind));
    }
    options.images = options.inputs;
}

std::string ImageMasterPath(const std::string& outDir) {
    return (fs::path(outDir) / "master.txt").string();
}

std::string ImageMasterText(const std::vector<std::string>& images, const std::string& masterDir) {
    std::error_code ec;
    const fs::path base = fs::absolute(masterDir, ec).lexically_normal();
    std::string text = std::string(kImageMasterHeader) +
                       "\n!fili;dbic;mmseg;dbiw;srcBgd;edgeClip;radioDif;dbmPxErr;role\n";
    for (const std::string& image : images) {
        if (image.find_first_of(";\r\n") != std::string::npos || image.front() == ' ' ||
            image.front() == '\t' || image.back() == ' ' || image.back() == '\t')
            throw UsageError(image +
                             ": a master parameter file cannot hold this path (it has \";\", a "
                             "line end, or blanks at its ends); rename the image");
        const fs::path absolute = fs::absolute(image, ec).lexically_normal();
        fs::path path = absolute.lexically_relative(base);
        if (path.empty())  // on another drive
            path = absolute;
        std::string written = path.generic_string();
        // A leading "!" would make the line a comment.
        if (written.front() == '!')
            written = "./" + written;
        // All channels, segment 0, no window, no source background, no edge clipping, any
        // radiometric difference, DBM pixel error 0; in the image set.
        text += written + ";;0;;;0;ANY;0;ORTHO\n";
    }
    return text;
}

namespace {

// The text of the master file that the images' master file would replace (empty: none). Refuses
// to replace one of the images, or a file that silvan-ortho did not write for images.
std::string ReplacedImageMaster(const Options& options) {
    std::error_code ec;
    if (!fs::exists(options.master, ec))
        return "";
    for (const std::string& image : options.images) {
        if (fs::equivalent(image, options.master, ec))
            throw UsageError(image + ": this image would be replaced by the master file " +
                             "written for the images; choose another --out");
    }
    std::ifstream in(options.master, std::ios::binary);
    const std::string old((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    const std::string header = std::string(kImageMasterHeader) + "\n";
    if (old.compare(0, header.size(), header) != 0)
        throw UsageError(options.master +
                         " exists and was not written by silvan-ortho for images; "
                         "choose another --out, or run that master file");
    return old;
}

}  // namespace

void PlanImageMaster(Options& options) {
    ImageMasterText(options.images, options.outDir);
    options.master = ImageMasterPath(options.outDir);
    ReplacedImageMaster(options);
}

void WriteImageMaster(const Options& options) {
    const std::string text = ImageMasterText(options.images, options.outDir);
    if (ReplacedImageMaster(options) != text)
        WriteFileAtomically(options.master, text);
}

}  // namespace ortho

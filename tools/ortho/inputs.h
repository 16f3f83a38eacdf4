// The files named on the command line: one master parameter file, or images given instead of
// it, told apart by their content; and the master file written for such images.
#pragma once

#include "options.h"

#include <string>
#include <vector>

namespace ortho {

// Sets options.master or options.images from options.inputs: a file that opens as a raster is
// an image, a text file is a master parameter file. A single name that does not exist is taken
// as the master file (the run then reports it). Throws UsageError, naming the file, for a mix
// of the two, several master files, or a file that is neither.
void ResolveInputs(Options& options);

// The name of the master file written for images: DIR/master.txt.
std::string ImageMasterPath(const std::string& outDir);

// The master file for images: a header naming the columns, then one line per image with the
// default columns; paths relative to masterDir when they can be. Throws UsageError for a path
// that a master file cannot hold (";", a line end, blanks around it).
std::string ImageMasterText(const std::vector<std::string>& images, const std::string& masterDir);

// Points options.master at the master file for options.images, DIR/master.txt, after checking
// that it can be written: every image path can be held, and no file there would be replaced
// that silvan-ortho did not write for images (nor an image). Throws UsageError.
void PlanImageMaster(Options& options);

// Writes that master file (the output directory exists), unless it holds those lines already.
// Throws UsageError as PlanImageMaster, FileAccessException when it cannot be written.
void WriteImageMaster(const Options& options);

}  // namespace ortho

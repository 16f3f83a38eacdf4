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

// Writes the master file of options.images into options.outDir (created when missing), unless
// it holds those lines already, and points options.master at it. Refuses, with a UsageError, to
// replace a file there that it did not write or one of the images.
void WriteImageMaster(Options& options);

}  // namespace ortho

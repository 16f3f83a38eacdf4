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

// (end of sensor models, output layout, footprint and metadata transfer)

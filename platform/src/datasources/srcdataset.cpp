// Source datasets and channel groups of the ortho-process utilities.
#include <kestrel/orthoutils.h>

#include <memory>

#include <kestrel/exception.h>

#include "gdaldataset.h"

using kestrel::DataException;
using kestrel::FormatString;
using kestrel::datasources::DataType;
using kestrel::datasources::IDataset;
using kestrel::datasources::IRasterDataset;

void GetSrcDataset(const std::string& path, IDataset*& dataset, unsigned int& width,
                   unsigned int& height) {
    auto opened = std::make_unique<kestrel::datasources::GdalRasterDataset>(path);
    width = opened->GetWidth();
    height = opened->GetHeight();
    dataset = opened.release();
}

void GetChanGroups(const std::string& path, const std::vector<unsigned int>& channels,
                   IDataset* dataset, std::vector<SrcChanInfo>& infos,
                   std::vector<ChanGroup>& groups, bool numberAcrossGroups) {
    std::unique_ptr<IDataset> own;
    if (dataset == nullptr) {
        own = std::make_unique<kestrel::datasources::GdalRasterDataset>(path);
        dataset = own.get();
    }
    const auto* raster = dynamic_cast<const IRasterDataset*>(dataset);
    if (raster == nullptr || !raster->IsValid()) {
        const std::string reason = dataset->GetInvalidReason();
        KESTREL_THROW(DataException, FormatString("%s is not a valid raster dataset%s%s",
                                                  dataset->GetPath().c_str(),
                                                  reason.empty() ? "" : ": ", reason.c_str()));
    }
    const unsigned int count = raster->GetChannelCount();
    std::vector<unsigned int> list = channels;
    if (list.empty()) {
        for (unsigned int c = 1; c <= count; ++c)
            list.push_back(c);
    }
    std::vector<SrcChanInfo> newInfos;
    std::vector<ChanGroup> newGroups;
    for (std::size_t i = 0; i < list.size(); ++i) {
        const unsigned int c = list[i];
        if (c == 0 || c > count) {
            KESTREL_THROW(DataException,
                          FormatString("Channel %u is not a channel of %s, which has %u "
                                       "channels",
                                       c, raster->GetPath().c_str(), count));
        }
        SrcChanInfo info;
        info.channel = c;
        info.dataType = raster->GetDataType(c);
        info.hasNoData = raster->GetNoDataValue(c, info.noData);
        info.description = raster->GetChannelDescription(c);
        ChanGroup* group = nullptr;
        for (ChanGroup& g : newGroups) {
            if (g.dataType == info.dataType)
                group = &g;
        }
        if (group == nullptr) {
            newGroups.emplace_back();
            group = &newGroups.back();
            group->dataType = info.dataType;
        }
        group->srcChans.push_back(c);
        group->orthoChans.push_back(numberAcrossGroups
                                        ? static_cast<unsigned int>(i + 1)
                                        : static_cast<unsigned int>(group->orthoChans.size() + 1));
        newInfos.push_back(std::move(info));
    }
    infos = std::move(newInfos);
    groups = std::move(newGroups);
}

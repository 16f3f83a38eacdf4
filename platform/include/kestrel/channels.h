// Channel lists of the ortho-process utilities.
#pragma once

#include <vector>

#include <kestrel/export.h>

// Turns a channel list as read from a parameter file into channel numbers. Every entry is a
// channel number, counted from 1, and stands for itself, in the order given; duplicates are
// kept. An entry of 0 or less names no channel and throws DataException with the whole list.
// On success dbic holds exactly the list's channels (it is emptied first); on failure it is
// left unchanged. An empty list gives no channels. The convention is in docs/channels.md.
KESTREL_API void ExpandChannelList(const std::vector<int>& list, std::vector<unsigned int>& dbic);

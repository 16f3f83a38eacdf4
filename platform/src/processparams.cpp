#include <kestrel/processparams.h>

#include <kestrel/exception.h>

#include <algorithm>
#include <charconv>
#include <mutex>
#include <utility>

namespace {

using kestrel::DataException;
using kestrel::FormatString;
using kestrel::SourceLocation;

const char* const kAcceptedForms =
    "accepted forms: \"\" or \"AUTO[:threads]\" (automatic choice), \"CPU[:threads]\" (central "
    "processor), \"GPU[:settings]\" (graphics processor) with settings separated by \";\" from "
    "\"device[,device...]\" or \"count=N\", \"threads=N\", \"streams=N\"; N from 0 to "
    "2147483647";

const char* const kCountRange = "a whole number from 0 to 2147483647";

struct ProcParameters {
    ProcessStrategy strategy = PROCESS_STRATEGY_AUTO;
    int threads = 0;
    int streams = 0;
    int count = 0;
    std::vector<int> devices;
};

bool IsBlank(char c) {
    return c == ' ' || c == '\t' || c == '\r' || c == '\n';
}

std::string Trim(const std::string& s) {
    std::size_t begin = 0;
    std::size_t end = s.size();
    while (begin < end && IsBlank(s[begin]))
        ++begin;
    while (end > begin && IsBlank(s[end - 1]))
        --end;
    return s.substr(begin, end - begin);
}

std::string Upper(std::string s) {
    std::transform(s.begin(), s.end(), s.begin(), [](char c) {
        return c >= 'a' && c <= 'z' ? static_cast<char>(c - 'a' + 'A') : c;
    });
    return s;
}

// The text for a message: control bytes, the NUL included, are shown as \xNN, so that the
// message shows all of the text and nothing that would cut or garble it.
std::string Printable(const std::string& text) {
    std::string out;
    for (const char c : text) {
        const unsigned char byte = static_cast<unsigned char>(c);
        if (byte < 0x20 || byte == 0x7F)
            out += FormatString("\\x%02X", static_cast<unsigned int>(byte));
        else
            out += c;
    }
    return out;
}

// Splits at every separator, keeping empty pieces so that they can be refused.
std::vector<std::string> Split(const std::string& s, char separator) {
    std::vector<std::string> pieces;
    std::size_t start = 0;
    for (;;) {
        const std::size_t end = s.find(separator, start);
        pieces.push_back(Trim(s.substr(start, end - start)));
        if (end == std::string::npos)
            return pieces;
        start = end + 1;
    }
}

// A whole non-negative decimal number that fits a signed 32-bit integer, digits only.
bool ReadCount(const std::string& text, int& value) {
    if (text.empty() || text[0] < '0' || text[0] > '9')
        return false;
    const char* end = text.data() + text.size();
    const auto result = std::from_chars(text.data(), end, value);
    return result.ec == std::errc() && result.ptr == end;
}

class Reader {
  public:
    Reader(const std::string& proc, const SourceLocation& where) : proc_(proc), where_(where) {}

    ProcParameters Read() {
        ProcParameters p;
        const std::string text = Trim(proc_);
        if (text.empty())
            return p;

        const std::size_t colon = text.find(':');
        const std::string kind = Upper(Trim(text.substr(0, colon)));
        if (kind == "AUTO") {
            p.strategy = PROCESS_STRATEGY_AUTO;
        } else if (kind == "CPU") {
            p.strategy = PROCESS_STRATEGY_CPU;
        } else if (kind == "GPU") {
            p.strategy = PROCESS_STRATEGY_GPU;
        } else {
            Fail(FormatString("unknown processor \"%s\"", Printable(kind).c_str()));
        }
        if (colon == std::string::npos)
            return p;

        const bool gpu = p.strategy == PROCESS_STRATEGY_GPU;
        bool threadsSet = false, streamsSet = false, countSet = false, devicesSet = false;
        for (const std::string& item : Split(text.substr(colon + 1), ';')) {
            if (item.empty())
                Fail("a setting is empty");
            const std::size_t eq = item.find('=');
            // A setting without a name is the thread count, or on a graphics processor the
            // device list.
            const std::string key = eq == std::string::npos ? (gpu ? "DEVICES" : "THREADS")
                                                            : Upper(Trim(item.substr(0, eq)));
            const std::string value = eq == std::string::npos ? item : Trim(item.substr(eq + 1));
            if (key == "THREADS") {
                Once(threadsSet, "threads");
                p.threads = Count("threads", value);
            } else if (gpu && key == "STREAMS") {
                Once(streamsSet, "streams");
                p.streams = Count("streams", value);
            } else if (gpu && key == "COUNT") {
                Once(countSet, "count");
                p.count = Count("count", value);
                if (p.count == 0)
                    Fail("count must be at least 1 (leave it out to use every device)");
            } else if (gpu && key == "DEVICES") {
                Once(devicesSet, "devices");
                p.devices = Devices(value);
            } else {
                Fail(FormatString("unknown setting \"%s\" for %s", Printable(item).c_str(),
                                  kind.c_str()));
            }
        }
        if (devicesSet && countSet)
            Fail("devices and count cannot both be given");
        return p;
    }

  private:
    [[noreturn]] void Fail(const std::string& reason) const {
        KESTREL_THROW_AT(where_, DataException,
                         FormatString("Cannot read PROC option \"%s\": %s; %s",
                                      Printable(proc_).c_str(), reason.c_str(), kAcceptedForms));
    }

    void Once(bool& seen, const char* name) const {
        if (seen)
            Fail(FormatString("%s is given more than once", name));
        seen = true;
    }

    int Count(const char* name, const std::string& value) const {
        int n = 0;
        if (!ReadCount(value, n)) {
            Fail(FormatString("%s \"%s\" is not %s", name, Printable(value).c_str(), kCountRange));
        }
        return n;
    }

    std::vector<int> Devices(const std::string& value) const {
        std::vector<int> devices;
        for (const std::string& item : Split(value, ',')) {
            const int device = Count("device", item);
            if (std::find(devices.begin(), devices.end(), device) != devices.end()) {
                Fail(FormatString("device %d is listed more than once", device));
            }
            devices.push_back(device);
        }
        return devices;
    }

    const std::string& proc_;
    SourceLocation where_;
};

void Store(ProcParameters p, ProcessStrategy& strategy, int& first, int& second, int& third,
           std::vector<int>& list) {
    strategy = p.strategy;
    first = p.threads;
    second = p.streams;
    third = p.count;
    list = std::move(p.devices);
}

struct ReaderSlot {
    std::mutex mutex;
    ProcessParametersReader reader;
};

ReaderSlot& Slot() {
    static ReaderSlot slot;
    return slot;
}

}  // namespace

void ParseProcOption(const std::string& proc, ProcessStrategy& strategy, int& first, int& second,
                     int& third, std::vector<int>& list) {
    Store(Reader(proc, KESTREL_HERE).Read(), strategy, first, second, third, list);
}

void GetProcessParameters(const std::string& proc, ProcessStrategy& strategy, int& first,
                          int& second, int& third, std::vector<int>& list) {
    ProcessParametersReader installed;
    {
        std::lock_guard<std::mutex> lock(Slot().mutex);
        installed = Slot().reader;
    }
    if (installed) {
        installed(proc, strategy, first, second, third, list);
        return;
    }
    Store(Reader(proc, KESTREL_HERE).Read(), strategy, first, second, third, list);
}

ProcessParametersReader SetProcessParametersReader(ProcessParametersReader reader) {
    std::lock_guard<std::mutex> lock(Slot().mutex);
    std::swap(Slot().reader, reader);
    return reader;
}

ScopedProcessParametersReader::ScopedProcessParametersReader(ProcessParametersReader reader)
    : previous_(SetProcessParametersReader(std::move(reader))) {}

ScopedProcessParametersReader::~ScopedProcessParametersReader() {
    SetProcessParametersReader(std::move(previous_));
}

#include "Plugins.h"

#include "Log.h"

#include <IC/InstCtrl.h>
#include <SD/Mutex.h>
#include <SD/PlatformUtilities.h>

#include <atomic>
#include <filesystem>
#include <string>

namespace icd {
namespace {

std::atomic<std::uint64_t> gFailures{0};

// Plug-in files in a directory: what a pass tries to load.
std::size_t candidates(std::string const& dir)
{
    std::error_code ec;
    std::size_t n = 0;
    for (auto it = std::filesystem::directory_iterator(dir, ec);
         !ec && it != std::filesystem::directory_iterator(); it.increment(ec)) {
        std::string const name = it->path().filename().string();
        if (name.size() > 3 && name.compare(name.size() - 3, 3, ".so") == 0)
            ++n;
    }
    return n;
}

void countPass()
{
    PluginCounts const now = Plugins::counts();
    std::size_t const mi = candidates(SD::PlatformUtilities::getBriscaMIDir());
    std::size_t const fp = candidates(SD::PlatformUtilities::getBriscaFPDir());
    std::uint64_t const failed = (mi > now.mi ? mi - now.mi : 0) + (fp > now.fp ? fp - now.fp : 0);
    gFailures += failed;
    if (failed != 0)
        ICD_LOG(4000, failed, " plug-in file(s) not loaded; -v shows the loader's reasons");
}

} // namespace

void Plugins::afterOpen()
{
    countPass();
}

void Plugins::reload()
{
    IC::InstCtrl::TimedReload();
    countPass();
}

PluginCounts Plugins::counts()
{
    PluginCounts c;
    {
        SD::MutexGuard guard(IC::InstCtrl::loadlock);
        c.mi = IC::InstCtrl::mymis.size();
        c.fp = IC::InstCtrl::myfps.size();
    }
    c.failures = gFailures.load();
    return c;
}

} // namespace icd

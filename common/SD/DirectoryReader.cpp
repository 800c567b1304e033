#include <SD/DirectoryReader.h>

#include <algorithm>
#include <cstring>

#include <dirent.h>

namespace SD {

namespace {

bool endsWith(char const* name, std::size_t nameLength, char const* suffix,
              std::size_t suffixLength)
{
    return nameLength >= suffixLength &&
           std::memcmp(name + nameLength - suffixLength, suffix, suffixLength) == 0;
}

} // namespace

DirectoryReader::DirectoryReader(char const* dir, char const* suffix)
{
    if (dir == nullptr)
        return;
    if (suffix == nullptr)
        suffix = "";
    DIR* d = opendir(dir);
    if (d == nullptr)
        return;
    std::size_t const suffixLength = std::strlen(suffix);
    std::vector<std::string> names;
    // No file-type filter: what a plug-in directory holds is for the loader
    // to judge, and d_type is not reliable on every file system anyway.
    while (dirent const* e = readdir(d)) {
        char const* name = e->d_name;
        if (std::strcmp(name, ".") == 0 || std::strcmp(name, "..") == 0)
            continue;
        if (endsWith(name, std::strlen(name), suffix, suffixLength))
            names.emplace_back(name);
    }
    closedir(d);

    // std::string compares like memcmp: byte-wise, whatever the locale.
    std::sort(names.begin(), names.end());
    // Callers find the bare name after strlen(dir) + 1 characters, so exactly
    // one separator is added, even after a directory that ends in one.
    std::string const prefix = std::string(dir) + '/';
    paths_.reserve(names.size());
    for (auto const& n : names)
        paths_.push_back(prefix + n);
}

DirectoryReader::~DirectoryReader() = default;

int DirectoryReader::getNumberOfFiles() const
{
    return static_cast<int>(paths_.size());
}

char const* DirectoryReader::getFileName(int index) const
{
    if (index < 0 || static_cast<std::size_t>(index) >= paths_.size())
        return nullptr;
    return paths_[static_cast<std::size_t>(index)].c_str();
}

} // namespace SD

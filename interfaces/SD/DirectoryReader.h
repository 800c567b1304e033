// SD::DirectoryReader: a snapshot listing of the entries of one directory
// whose names end with a suffix (case-sensitive), sorted by name.
#pragma once

#include <IC/CommonExport.h>

#include <string>
#include <vector>

namespace SD {

class ICCOMMON_API DirectoryReader {
public:
    // A directory that cannot be read gives zero entries. "." and ".." are
    // never listed; entries of every file type are.
    DirectoryReader(char const* dir, char const* suffix);
    ~DirectoryReader();
    DirectoryReader(DirectoryReader const&) = delete;
    DirectoryReader& operator=(DirectoryReader const&) = delete;

    int getNumberOfFiles() const;
    // The directory as given, one separator and the entry's name; owned by
    // the reader. Null for an index out of range.
    char const* getFileName(int index) const;

private:
    std::vector<std::string> paths_;
};

} // namespace SD

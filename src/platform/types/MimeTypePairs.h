#pragma once
// Reads the two-column files of a shared-mime-info database ("subclasses":
// a type and one of its parents; "aliases": an alias and its canonical
// type), one pair per line, the columns separated by blanks.

#include <string>
#include <vector>

namespace qm {

struct MimeTypePair {
    std::string first;
    std::string second;
};

// The file's pairs in file order, as written (not lower-cased). A missing
// file or folder gives none silently: most data directories have no mime
// database. A file that cannot be read, or is larger than 4 MiB, gives none
// and logs one line; lines that are not two columns are skipped, with one
// log line per file that counts them. Empty lines and "#" comments are skipped.
std::vector<MimeTypePair> readMimeTypePairs(const std::string& path);

}  // namespace qm

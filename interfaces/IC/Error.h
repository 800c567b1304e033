// IC::Error: the outcome value returned by every library operation.
//
// Status codes: 0 success, 1 failure, 5 plug-in loading failed,
// 6 node already known. Callers test getStatus() against zero.
#pragma once

#include <IC/CommonExport.h>
#include <IC/Number.h>

#include <iosfwd>
#include <string>

namespace IC {

class ICCOMMON_API Error {
public:
    // Text and status; the code is Number(Number::Generic).
    Error(char const* text, unsigned char status);
    Error(unsigned char status, Number const& code, std::string const& text);

    unsigned char getStatus() const { return status_; }
    Number const& getCode() const { return code_; }
    std::string const& getText() const { return text_; }

    // "status=1 code=kind 0 text=NodeStore Duplicated Node Pointer"
    operator std::string() const;

private:
    unsigned char status_;
    Number code_;
    std::string text_;
};

ICCOMMON_API std::ostream& operator<<(std::ostream& os, Error const& e);

} // namespace IC

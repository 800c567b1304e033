// The body of a shipped management interface's OpenMI entry point.
#pragma once

#include <IC/Error.h>
#include <IC/ManagementInterface.h>
#include <IC/Number.h>

#include <string>

namespace shipped {

// Hands out a new MI of type T; "<name>: out of memory" when it cannot.
template <class T>
unsigned char openMI(IC::ManagementInterface** mi, IC::Error** err, char const* name)
{
    static IC::Error good(0, IC::Number(IC::Number::Generic), std::string());
    static IC::Error bad(1, IC::Number(IC::Number::Generic), std::string(name) + ": out of memory");
    if (!mi || !err)
        return 1;
    try {
        *mi = new T();
    } catch (...) {
        *err = &bad;
        return 1;
    }
    *err = &good;
    return 0;
}

} // namespace shipped

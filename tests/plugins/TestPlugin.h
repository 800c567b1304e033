// What the two test plug-ins share: their build's name, instance and mode,
// the record of their image, and the entry point. IC_TEST_NAME names the
// build, IC_TEST_INSTANCE keeps its nodes' paths apart from the other
// builds', IC_TEST_MODE picks what it does.
#pragma once

#include "Probe.h"

#include <IC/Error.h>
#include <IC/Number.h>

#include <mutex>
#include <set>
#include <stdexcept>
#include <string>

enum Mode {
    MODE_GOOD, MODE_THREAD, MODE_SLOW, MODE_NO_ENTRY, MODE_CODE, MODE_NULL_ERROR, MODE_ERROR_STATUS,
    MODE_NULL_OBJECT, MODE_INIT_FAILS, MODE_REG_FAILS, MODE_GETMAP_FAILS, MODE_GETMAP_THROWS,
    MODE_THROW_OPEN, MODE_THROW_INIT, MODE_THROW_INT, MODE_THROW_INT_OPEN,
    MODE_ANNOUNCE, // announces its nodes through MapNewFPNode when initialised
    MODE_RELAY,    // re-raises the alerts of management interfaces
    MODE_UPDATE_FAILS
};

namespace {

std::string const kName = IC_TEST_NAME;
constexpr unsigned int kInstance = IC_TEST_INSTANCE;
constexpr Mode kMode = IC_TEST_MODE;

IC::Error ok()
{
    return IC::Error(0, IC::Number(IC::Number::Generic), "");
}

// Objects the loader abandoned (it does not release a plug-in that failed
// half-way) are freed when the image goes; the probe sees the image come and
// go.
template <class Object>
struct Image {
    Image() { ictestprobe::imageLoaded(kName); }
    ~Image()
    {
        for (Object* o : live)
            delete o;
        ictestprobe::imageUnloaded(kName);
    }
    void add(Object* o)
    {
        std::lock_guard<std::mutex> g(m);
        live.insert(o);
    }
    void remove(Object* o)
    {
        std::lock_guard<std::mutex> g(m);
        live.erase(o);
    }
    std::mutex m;
    std::set<Object*> live;
};

// The entry point's work: records "<name>:<entry>", then hands out a new
// Object and a good error, or fails the way the mode says.
template <class Object, class Base>
unsigned char open(char const* entry, Base** object, IC::Error** err, unsigned int refusal)
{
    static IC::Error good = ok(), bad(1, IC::Number(refusal), kName.substr(0, 2) + " refused");
    ictestprobe::record(kName + ":" + entry);
    if (kMode == MODE_CODE)
        return 'X';
    if (kMode == MODE_THROW_OPEN)
        throw std::runtime_error("open exploded");
    if (kMode == MODE_THROW_INT_OPEN)
        throw 42;
    if (kMode != MODE_NULL_OBJECT)
        *object = new Object;
    if (kMode != MODE_NULL_ERROR)
        *err = kMode == MODE_ERROR_STATUS ? &bad : &good;
    return 0;
}

} // namespace

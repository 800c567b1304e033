// A library a stand-in plug-in depends on, found through the plug-in's run
// path "$ORIGIN": beside the plug-in, wherever it was copied.
extern "C" __attribute__((visibility("default"))) int trust_dep_value()
{
    return 7;
}

// MIF text as a site or a package might ship it, read by the provider's
// parser. Whatever parses must write back to text that parses to the same
// content (the database files depend on it).
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "dmisp/miftext.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    if (size > 64 * 1024)
        return 0;
    std::string text(reinterpret_cast<const char*>(data), size);
    dmisp::Component component;
    std::string error;
    if (!dmisp::parseMif(text, "fuzz.mif", &component, &error)) {
        if (error.empty())
            abort(); // a refusal always says where and why
        return 0;
    }
    std::string written = dmisp::writeMif(component);
    dmisp::Component again;
    if (!dmisp::parseMif(written, "written.mif", &again, &error)) {
        // The writer produced text its own parser refuses.
        fprintf(stderr, "%s\n--- written:\n%s\n", error.c_str(), written.c_str());
        abort();
    }
    if (dmisp::writeMif(again) != written) {
        fprintf(stderr, "--- first:\n%s\n--- second:\n%s\n", written.c_str(), dmisp::writeMif(again).c_str());
        abort(); // the round trip changed the content
    }
    return 0;
}

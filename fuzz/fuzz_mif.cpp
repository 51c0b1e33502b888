// MIF text as a site or a package might ship it, read by the provider's
// parser. What parses must write back to text that parses to the same content
// (the database files depend on it); a refusal always says why.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "dmisp/miftext.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    if (size > 64 * 1024)
        return 0;
    dmisp::Component component, again;
    std::string error;
    if (!dmisp::parseMif(std::string(reinterpret_cast<const char*>(data), size), "fuzz.mif", &component, &error))
        return error.empty() ? (abort(), 0) : 0;
    std::string written = dmisp::writeMif(component);
    if (!dmisp::parseMif(written, "written.mif", &again, &error) || dmisp::writeMif(again) != written) {
        fprintf(stderr, "%s\n--- written:\n%s\n", error.c_str(), written.c_str());
        abort(); // the writer's text is refused or reads back different
    }
    return 0;
}

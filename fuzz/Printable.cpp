#include "Printable.h"

#include "Input.h"

#include <algorithm>
#include <sstream>

void expectPrintable(const std::string& text)
{
    const auto isControl = [](char byte) { return byte != '\n' && ((byte >= 0 && byte < ' ') || byte == 0x7F); };
    expect(std::none_of(text.begin(), text.end(), isControl), "a printable text");
}

void expectPrintable(const Report& report)
{
    std::ostringstream out;
    report.write(false, out);
    report.write(true, out); // throws when a text is not UTF-8
    expectPrintable(out.str());
}

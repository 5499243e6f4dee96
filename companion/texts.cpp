#include "texts.h"

#include "embedded.h"

const nlohmann::ordered_json& catalogue(const char* section)
{
    static const nlohmann::ordered_json all = [] {
        auto texts = nlohmann::ordered_json::parse(embeddedCatalogue);
        texts.update(nlohmann::ordered_json::parse(embeddedCommands));
        return texts;
    }();
    return all.at(section);
}

std::string unfilled(const nlohmann::ordered_json& text)
{
    if (text.is_string()) {
        return text.get<std::string>();
    }
    std::string result;
    for (const auto& line : text) {
        result += (result.empty() ? "" : " ") + line.get<std::string>();
    }
    return result;
}

std::string filled(const nlohmann::ordered_json& text, const Values& values)
{
    const std::string pattern = unfilled(text);
    std::string result;
    std::size_t position = 0;
    for (std::size_t open = 0; (open = pattern.find('{', position)) != std::string::npos;) {
        const std::size_t close = pattern.find('}', open);
        const std::string name = pattern.substr(open + 1, close - open - 1);
        const auto value = values.find(name);
        result += pattern.substr(position, open - position);
        result += value != values.end() ? value->second : filled(catalogue("texts").at(name), values);
        position = close + 1;
    }
    return result + pattern.substr(position);
}

std::string sharedText(const char* name)
{
    return filled(catalogue("texts").at(name), {});
}

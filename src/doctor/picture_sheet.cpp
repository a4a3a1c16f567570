#include "doctor/picture_sheet.h"

#include <cstdlib>

#include "doctor/lines.h"

namespace pelorus::doctor {

namespace {

// To a hundredth, and the same in every locale.
std::string number(double value) {
    const auto hundredths = static_cast<long>(value * 100 + (value < 0 ? -0.5 : 0.5));
    std::string text = std::to_string(std::labs(hundredths) / 100);
    if (const long rest = std::labs(hundredths) % 100; rest != 0) {
        text += rest < 10 ? ".0" : ".";
        text += std::to_string(rest % 10 == 0 ? rest / 10 : rest);
    }
    return hundredths < 0 ? "-" + text : text;
}

std::string escaped(std::string_view text) {
    std::string result;
    for (const char letter : printable(text)) {
        switch (letter) {
            case '&':
                result += "&amp;";
                break;
            case '<':
                result += "&lt;";
                break;
            case '>':
                result += "&gt;";
                break;
            default:
                result += letter;
        }
    }
    return result;
}

std::string attribute(const char* name, const std::string& value) {
    return std::string{" "} + name + "=\"" + value + "\"";
}

std::string attribute(const char* name, double value) {
    return attribute(name, number(value));
}

}  // namespace

void PictureSheet::write(std::string_view text, const Writing& writing) {
    shapes += "  <text" + attribute("x", writing.x) + attribute("y", writing.y) +
              attribute("font-size", writing.size) + attribute("fill", writing.colour);
    if (writing.anchor != std::string_view{"start"}) {
        shapes += attribute("text-anchor", writing.anchor);
    }
    if (writing.bold) shapes += attribute("font-weight", "bold");
    shapes += ">" + escaped(text) + "</text>\n";
}

void PictureSheet::draw(const Box& box) {
    shapes += "  <rect" + attribute("x", box.x) + attribute("y", box.y) +
              attribute("width", box.width) + attribute("height", box.height);
    if (box.radius > 0) shapes += attribute("rx", box.radius);
    shapes += attribute("fill", box.colour) + " />\n";
}

void PictureSheet::drawVertical(double x, double top, double bottom, const char* colour) {
    shapes += "  <line" + attribute("x1", x) + attribute("x2", x) + attribute("y1", top) +
              attribute("y2", bottom) + attribute("stroke", colour) + " />\n";
}

std::string PictureSheet::svg(double width, double height) const {
    PictureSheet paper;
    paper.draw({0, 0, width, height, kWhite, 8});
    return "<svg xmlns=\"http://www.w3.org/2000/svg\"" + attribute("width", width) +
           attribute("height", height) +
           attribute("viewBox", "0 0 " + number(width) + " " + number(height)) +
           attribute("font-family", "sans-serif") + attribute("fill", kInk) + ">\n" + paper.shapes +
           shapes + "</svg>\n";
}

}  // namespace pelorus::doctor

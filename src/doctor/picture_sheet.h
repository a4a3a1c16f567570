// A drawing that a web page can show: SVG without script, style or link.
#ifndef PELORUS_DOCTOR_PICTURE_SHEET_H
#define PELORUS_DOCTOR_PICTURE_SHEET_H

#include <string>
#include <string_view>

namespace pelorus::doctor {

inline constexpr const char* kInk = "#1a202c";
inline constexpr const char* kQuiet = "#4a5568";
inline constexpr const char* kPale = "#e2e8f0";
inline constexpr const char* kWhite = "#ffffff";

/// Where and how a line of text is written.
struct Writing {
    double x{}, y{};
    int size = 14;
    const char* colour = kInk;
    const char* anchor = "start";  ///< which part of the text is at x: start, middle or end
    bool bold = false;
};

/// A rectangle.
struct Box {
    double x{}, y{}, width{}, height{};
    const char* colour = kInk;
    double radius = 0;
};

/// The drawing. What is added later lies above.
class PictureSheet {
public:
    void write(std::string_view text, const Writing& writing);
    void draw(const Box& box);
    void drawVertical(double x, double top, double bottom, const char* colour);

    /// The whole file, with @p width and @p height in pixels.
    [[nodiscard]] std::string svg(double width, double height) const;

private:
    std::string shapes;
};

}  // namespace pelorus::doctor

#endif

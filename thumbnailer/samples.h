#pragma once

#include <string_view>

/// Small drawings and documents that use what others will use: text in the usual fonts, a picture
/// within, a gradient.
namespace yomber::thumbnailer {

inline constexpr std::string_view kDrawingSample = R"svg(<svg xmlns="http://www.w3.org/2000/svg"
 xmlns:xlink="http://www.w3.org/1999/xlink" width="64" height="64">
<defs><linearGradient id="g"><stop offset="0" stop-color="red"/><stop offset="1" stop-color="blue"/>
</linearGradient><filter id="f"><feGaussianBlur stdDeviation="1"/></filter></defs>
<rect width="64" height="64" fill="url(#g)" filter="url(#f)"/>
<image width="8" height="8" xlink:href="data:image/png;base64,iVBORw0KGgoAAAANSUhEUgAAAAEAAAABCAIAAACQd1PeAAAADElEQVR4nGNgYGAAAAAEAAH2FzhVAAAAAElFTkSuQmCC"/>
<text y="10" font-family="sans-serif" font-size="8">Ag 1 äß αж</text>
<text y="20" font-family="sans-serif" font-weight="bold" font-size="8">Ag 1</text>
<text y="30" font-family="serif" font-size="8">Ag 1</text>
<text y="40" font-family="serif" font-weight="bold" font-size="8">Ag 1</text>
<text y="50" font-family="monospace" font-size="8">Ag 1</text>
<text y="60" font-family="Unknown Of Everybody" font-style="italic" font-size="8">Ag 1</text>
</svg>)svg";

inline constexpr std::string_view kDocumentSample = R"pdf(%PDF-1.4
1 0 obj
<< /Type /Catalog /Pages 2 0 R >>
endobj
2 0 obj
<< /Type /Pages /Kids [3 0 R] /Count 1 >>
endobj
3 0 obj
<< /Type /Page /Parent 2 0 R /MediaBox [0 0 200 200] /Contents 4 0 R
/Resources << /Font << /A << /Type /Font /Subtype /Type1 /BaseFont /Helvetica >>
/B << /Type /Font /Subtype /Type1 /BaseFont /Helvetica-Bold >>
/C << /Type /Font /Subtype /Type1 /BaseFont /Times-Roman >>
/D << /Type /Font /Subtype /Type1 /BaseFont /Times-Bold >>
/E << /Type /Font /Subtype /Type1 /BaseFont /Courier >>
/F << /Type /Font /Subtype /Type1 /BaseFont /Symbol >> >> >> >>
endobj
4 0 obj
<< /Length 158 >>
stream
BT /A 12 Tf 10 180 Td (Ag 1) Tj /B 12 Tf 0 -20 Td (Ag 1) Tj /C 12 Tf 0 -20 Td (Ag 1) Tj
/D 12 Tf 0 -20 Td (Ag 1) Tj /E 12 Tf 0 -20 Td (Ag 1) Tj /F 12 Tf 0 -20 Td (ab) Tj ET
endstream
endobj
trailer
<< /Root 1 0 R >>
%%EOF
)pdf";

}  // namespace yomber::thumbnailer

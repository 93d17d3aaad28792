#include "tools/report/PageParts.h"

// The assembler reads a file into the program's constants.
#define VX_PART(name, path)                                                                  \
  asm(".pushsection .rodata\n.global vx_page_" #name "\nvx_page_" #name ":\n.incbin \"" path \
      "\"\n.global vx_page_" #name "_end\nvx_page_" #name "_end:\n.byte 0\n.popsection\n");  \
  extern "C" const char vx_page_##name[];                                                    \
  extern "C" const char vx_page_##name##_end[]

VX_PART(html, VX_PAGE_FOLDER "/page.html");
VX_PART(style, VX_PAGE_FOLDER "/page.css");
VX_PART(script, VX_PAGE_FOLDER "/page.js");
VX_PART(charts, VX_PAGE_CHARTS);
VX_PART(licence, VX_PAGE_FOLDER "/chart-licence.txt");

namespace vx::report {

PageParts pageParts() {
  return {.html = {vx_page_html, vx_page_html_end},
          .style = {vx_page_style, vx_page_style_end},
          .script = {vx_page_script, vx_page_script_end},
          .charts = {vx_page_charts, vx_page_charts_end},
          .chartsLicence = {vx_page_licence, vx_page_licence_end}};
}

}  // namespace vx::report

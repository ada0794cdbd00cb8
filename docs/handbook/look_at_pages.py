#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""usage: look_at_pages.py HTML_FOLDER [PICTURES]      see scripts/check-handbook"""
import pathlib
import sys

from selenium import webdriver

WIDTHS = {"phone": 390, "desktop": 1440}
# Returns what is wrong with the page as a reader sees it. Contrast as WCAG 2.1 counts it: 4.5, large text 3.
LOOK = """
const wrong = [];
const root = document.documentElement;
if (root.scrollWidth > root.clientWidth + 1) {
  const wide = [...document.querySelectorAll('body *')].filter(e => {
    const box = e.getBoundingClientRect();
    if (!box.width || box.right <= root.clientWidth + 1 || box.left < 0) return false;
    for (let p = e.parentElement; p; p = p.parentElement)
      if (['auto', 'scroll', 'hidden'].includes(getComputedStyle(p).overflowX)) return false;
    return true;
  });
  wrong.push(`${root.scrollWidth} wide in ${root.clientWidth}: ` + wide.slice(0, 3).map(e => e.outerHTML.slice(0, 80)).join(' | '));
}
for (const image of document.images)
  if (!image.complete || !image.naturalWidth) wrong.push('picture does not show: ' + image.src);
const parse = text => { const m = text.match(/[\\d.]+/g).map(Number); return m.length > 3 ? m : [...m, 1]; };
const over = (top, below) => [0, 1, 2].map(i => top[i] * top[3] + below[i] * (1 - top[3])).concat(1);
const light = c => { const f = v => (v /= 255) <= 0.03928 ? v / 12.92 : ((v + 0.055) / 1.055) ** 2.4;
                     return 0.2126 * f(c[0]) + 0.7152 * f(c[1]) + 0.0722 * f(c[2]); };
const behind = e => { const layers = [];
  for (let p = e; p; p = p.parentElement) { const c = parse(getComputedStyle(p).backgroundColor); layers.push(c); if (c[3] == 1) break; }
  let colour = [255, 255, 255, 1];
  for (const layer of layers.reverse()) colour = over(layer, colour);
  return colour; };
const seen = new Set();
const walker = document.createTreeWalker(document.querySelector('article') || document.body, NodeFilter.SHOW_TEXT);
while (walker.nextNode()) {
  const e = walker.currentNode.parentElement;
  if (!walker.currentNode.data.trim() || seen.has(e) || !e.getClientRects().length) continue;
  seen.add(e);
  const style = getComputedStyle(e);
  if (style.visibility == 'hidden' || e.closest('.headerlink, .copybtn, script, style')) continue;
  const back = behind(e), colour = over(parse(e.closest('svg') ? style.fill : style.color), back);
  const [a, b] = [light(colour), light(back)].sort((x, y) => y - x);
  const contrast = (a + 0.05) / (b + 0.05), size = parseFloat(style.fontSize);
  const least = size >= 24 || (size >= 18.66 && style.fontWeight >= 700) ? 3 : 4.5;
  if (contrast < least) wrong.push(`contrast ${contrast.toFixed(2)}: "${walker.currentNode.data.trim().slice(0, 40)}" (${e.className})`);
  if (size < 11) wrong.push(`text of ${size} px: "${walker.currentNode.data.trim().slice(0, 40)}"`);
}
return wrong.slice(0, 6);
"""


def main():
    folder = pathlib.Path(sys.argv[1]).resolve()
    pictures = pathlib.Path(sys.argv[2]) if len(sys.argv) > 2 else None
    pages = sorted(path for path in folder.rglob("*.html") if path.name not in ("genindex.html", "search.html"))
    if not pages:
        print(f"check-handbook: no pages in {folder}; build them: cmake --build --preset dev --target handbook", file=sys.stderr)
        return 2
    options = webdriver.ChromeOptions()
    for option in ("--headless=new", "--no-sandbox", "--disable-gpu", "--hide-scrollbars"):
        options.add_argument(option)
    driver = webdriver.Chrome(options=options)
    faults = 0
    try:
        for theme in ("light", "dark"):
            driver.execute_cdp_cmd("Emulation.setEmulatedMedia",
                                   {"features": [{"name": "prefers-color-scheme", "value": theme}]})
            for name, width in WIDTHS.items():
                driver.execute_cdp_cmd("Emulation.setDeviceMetricsOverride",
                                       {"width": width, "height": 1000, "deviceScaleFactor": 1, "mobile": name == "phone"})
                for page in pages:
                    driver.get(page.as_uri())
                    for fault in driver.execute_script(LOOK):
                        print(f"{page.relative_to(folder)}, {name}, {theme}: {fault}")
                        faults += 1
                    if pictures:
                        pictures.mkdir(parents=True, exist_ok=True)
                        driver.save_screenshot(str(pictures / f"{page.stem}-{name}-{theme}.png"))
    finally:
        driver.quit()
    print(f"{len(pages)} pages, {len(WIDTHS)} widths, light and dark: {faults} faults")
    return 1 if faults else 0


if __name__ == "__main__":
    sys.exit(main())

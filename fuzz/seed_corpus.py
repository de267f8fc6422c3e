#!/usr/bin/env python3
"""Writes the seed corpus of every fuzz target into fuzz/corpus/<target>/.

Seeds are small valid inputs and edge cases; files named seed-* belong to this
script and are rewritten by it. Inputs the fuzzer found (regression-* files)
are never touched. Run from anywhere: python3 fuzz/seed_corpus.py
"""
import os
import struct
import zlib

HERE = os.path.dirname(os.path.abspath(__file__))


def put(target, name, data):
    d = os.path.join(HERE, "corpus", target)
    os.makedirs(d, exist_ok=True)
    if isinstance(data, str):
        data = data.encode()
    with open(os.path.join(d, "seed-" + name), "wb") as f:
        f.write(data)


# --- request_stream: 12-byte headers {cmd, cid, item_id} and what follows ----
def hdr(cmd, item=0, cid=7):
    return struct.pack("<iii", cmd, cid, item)


def i32(v):
    return struct.pack("<i", v)


def u16(v):
    return struct.pack("<H", v)


def wire_string(text):
    return i32(len(text)) + text.encode()


every_query = b"".join(hdr(c, 1) for c in range(3, 10)) + hdr(10) + hdr(11) + i32(6)
put("request_stream", "every-query", every_query)
put("request_stream", "items-2-3-99", b"".join(hdr(c, i) for i in (2, 3, 99) for c in (3, 6, 7, 9)))
put("request_stream", "ids-dirty", hdr(11) + i32(0) + u16(1) + i32(1) + hdr(11) + i32(0) + u16(1) + i32(-1))
put("request_stream", "ids-bad-selector", hdr(11) + i32(0) + u16(2) + hdr(3, 1))
put("request_stream", "ids-cut-short", hdr(11) + i32(0) + b"\x01")
put("request_stream", "negative-item", hdr(3, -1) + hdr(7, -5) + hdr(5, -1) + hdr(3, 1))
put("request_stream", "unknown-commands", hdr(12) + hdr(-3) + hdr(0x7FFFFFFF) + hdr(4, 1))
put("request_stream", "free-shm-then-more", hdr(2) + hdr(3, 1))
put("request_stream", "icon-twice-after-free", hdr(7, 1) + hdr(2) + hdr(7, 1))
put("request_stream", "command-0", hdr(0) + hdr(3, 1))
put("request_stream", "cid-0", hdr(3, 1, cid=0))
put("request_stream", "short-header", hdr(3, 1)[:7])
put("request_stream", "initialize",
    hdr(1) + struct.pack("<dd", 37.5, 127.0) + i32(0) + wire_string("10.0.1") + hdr(10))
put("request_stream", "initialize-no-version", hdr(1) + struct.pack("<dd", 37.5, 127.0) + i32(6) + hdr(3, 1))
put("request_stream", "initialize-nan", hdr(1) + struct.pack("<dd", float("nan"), 1e308) + i32(0) + i32(0))
put("request_stream", "initialize-long-version", hdr(1) + struct.pack("<dd", 0, 0) + i32(0) + i32(5000) + b"x" * 64)
put("request_stream", "initialize-cut", hdr(1) + b"\x00" * 9)
put("request_stream", "empty", b"")

# --- item_list_json --------------------------------------------------------
ICON = "http://127.0.0.1/icons/seed.png"


def item(url, name=None, extra="", icons=None):
    body = '"siteUrl":"%s"' % url
    if name is not None:
        body += ',"siteName":"%s"' % name
    body += extra
    if icons is not None:
        body += ',"touchIcons":[%s]' % ",".join(icons)
    return '{"body":{%s}}' % body


def icon(path=ICON, size="2x2", admin=1, modified="2024-01-01T00:00:00Z"):
    return '{"id":1,"iconPath":"%s","iconSize":"%s","isAdministered":%d,"lastModified":"%s"}' % (
        path, size, admin, modified)


full = ('{"itemCount":3,"global":{"items":[%s,%s]},"regional":{"items":[%s]}}' % (
    item("http://stored.example/", "Stored again", ',"predominantColor":"#ff0000","favIconExists":true',
         [icon(), icon("http://127.0.0.1/icons/other.png", "120x120", 0)]),
    item("http://new.example/", "New", ',"isSpeciallyRemoved":false,"touchIconsExists":1'),
    item("http://regional.example/", None, ',"numberOfTouchIcons":2.7')))
put("item_list_json", "global-and-regional", full)
put("item_list_json", "root-items", '{"items":[%s,7,"x",null,%s]}' % (
    item("http://a.example/"), item("http://removed.example/", "", ',"isSpeciallyRemoved":true')))
put("item_list_json", "duplicates", '{"items":[%s,%s,%s]}' % (
    item("http://d.example/", "First"), item("http://d.example/", "Second", ',"isSpeciallyRemoved":1'),
    item("http://d.example/", "Third")))
put("item_list_json", "prefix-names", '{"items":[{"b":{"siteUrlX":"http://p.example/","siteNameY":"P",'
    '"touchIconsList":[1],"touchIconsExists":true,"touchIcons":{"a":{"iconPathZ":"%s",'
    '"iconSize":"123456789012345","lastModified":"123456789012345678901234567890"}}}}]}' % ICON)
put("item_list_json", "empty-element-stops", '{"items":[{},%s]}' % item("http://late.example/"))
put("item_list_json", "numbers", '{"items":[{"b":{"siteUrl":"http://n.example/","numberOfTouchIcons":1e300,'
    '"favIconExists":-1,"touchIconsExists":18446744073709551615,"isSpeciallyRemoved":0.5}}]}')
put("item_list_json", "deep", "[" * 70 + "]" * 70)
put("item_list_json", "repeated-names", '{"items":[{"b":{%s}}]}' % ",".join(['"siteUrl":"http://r.example/"'] * 50))
put("item_list_json", "escapes", '{"items":[{"b":{"siteUrl":"http://e.example/\\u00e9\\ud83d\\ude00\\u0000x",'
    '"siteName":"a\\"b\\\\c"}}]}')
put("item_list_json", "not-json", "items: [")
put("item_list_json", "scalar-root", "42")
put("item_list_json", "empty-object", "{}")

# --- png_decode ---------------------------------------------------------------
def chunk(kind, data):
    c = kind + data
    return struct.pack(">I", len(data)) + c + struct.pack(">I", zlib.crc32(c) & 0xFFFFFFFF)


ADAM7 = [(0, 0, 8, 8), (4, 0, 8, 8), (0, 4, 4, 8), (2, 0, 4, 4), (0, 2, 2, 4), (1, 0, 2, 2), (0, 1, 1, 2)]


def pack_row(samples, depth):
    if depth >= 8:
        fmt = ">" + ("B" if depth == 8 else "H") * len(samples)
        return struct.pack(fmt, *samples)
    out, acc, bits = bytearray(), 0, 0
    for s in samples:
        acc = (acc << depth) | s
        bits += depth
        if bits == 8:
            out.append(acc)
            acc, bits = 0, 0
    if bits:
        out.append(acc << (8 - bits))
    return bytes(out)


def png(width, height, color_type, depth, pixel, interlace=0, extra=b"", palette=None):
    channels = {0: 1, 2: 3, 3: 1, 4: 2, 6: 4}[color_type]
    raw = bytearray()
    passes = ADAM7 if interlace else [(0, 0, 1, 1)]
    for x0, y0, dx, dy in passes:
        xs = list(range(x0, width, dx))
        if not xs:
            continue
        for y in range(y0, height, dy):
            samples = []
            for x in xs:
                samples += pixel(x, y)[:channels]
            raw += b"\x00" + pack_row(samples, depth)
    out = b"\x89PNG\r\n\x1a\n" + chunk(b"IHDR", struct.pack(">IIBBBBB", width, height, depth, color_type, 0, 0, interlace))
    if palette is not None:
        out += chunk(b"PLTE", palette)
    return out + extra + chunk(b"IDAT", zlib.compress(bytes(raw))) + chunk(b"IEND", b"")


put("png_decode", "rgba-1x1", png(1, 1, 6, 8, lambda x, y: [10, 20, 30, 40]))
put("png_decode", "rgb-3x2", png(3, 2, 2, 8, lambda x, y: [x * 80, y * 100, 7]))
put("png_decode", "grey-1bit-9x3", png(9, 3, 0, 1, lambda x, y: [(x + y) & 1]))
put("png_decode", "grey-alpha-16bit", png(2, 2, 4, 16, lambda x, y: [x * 60000, y * 40000]))
put("png_decode", "palette-trns", png(4, 1, 3, 2, lambda x, y: [x], palette=bytes(range(12)),
                                      extra=chunk(b"tRNS", b"\x00\x80")))
put("png_decode", "rgb-trns", png(2, 1, 2, 8, lambda x, y: [x, 0, 0], extra=chunk(b"tRNS", b"\x00\x00\x00\x00\x00\x00")))
put("png_decode", "interlaced-5x5", png(5, 5, 6, 8, lambda x, y: [x, y, x * y, 255], interlace=1))
put("png_decode", "rgba16-interlaced", png(3, 3, 6, 16, lambda x, y: [x * 999, y * 999, 1, 65535], interlace=1))
huge = b"\x89PNG\r\n\x1a\n" + chunk(b"IHDR", struct.pack(">IIBBBBB", 100000, 100000, 8, 6, 0, 0, 0))
put("png_decode", "huge-dimensions", huge + chunk(b"IDAT", zlib.compress(b"\x00" * 64)) + chunk(b"IEND", b""))
big = b"\x89PNG\r\n\x1a\n" + chunk(b"IHDR", struct.pack(">IIBBBBB", 4096, 4096, 8, 6, 0, 0, 0))
put("png_decode", "big-claim-little-data", big + chunk(b"IDAT", zlib.compress(b"\x00" * 64)) + chunk(b"IEND", b""))
good = png(2, 2, 6, 8, lambda x, y: [1, 2, 3, 4])
put("png_decode", "truncated", good[:-20])
put("png_decode", "bad-crc", good[:40] + bytes([good[40] ^ 0xFF]) + good[41:])
put("png_decode", "signature-only", b"\x89PNG\r\n\x1a\n")
put("png_decode", "not-png", b"GIF89a\x01\x00\x01\x00")

# --- server_list_xml ----------------------------------------------------------
with open(os.path.join(HERE, "..", "packaging", "site_deck_server_data.xml")) as f:
    put("server_list_xml", "installed", f.read())


def server(sid, url, wait="2000", retry="2", fall="false"):
    return ("<Server><Id>%s</Id><Base-url>%s</Base-url><WaitTime>%s</WaitTime>"
            "<RetryCount>%s</RetryCount><FallBack>%s</FallBack></Server>" % (sid, url, wait, retry, fall))


put("server_list_xml", "one-server", "<values>%s</values>" % server(1, "http://a.example/SiteDeck/x"))
put("server_list_xml", "odd-numbers", "<values>%s%s</values>" % (
    server("99999999999", "http://b.example/", "-5", "x", "TRUE"), server(" -7z", "", "", "")))
put("server_list_xml", "two-ids", "<values><Server><Id>3</Id><Id>4</Id><Base-url>http://c/</Base-url>"
    "<Base-url>http://d/<b>bold</b></Base-url></Server><Server/></values>")
put("server_list_xml", "entities", '<?xml version="1.0"?><!DOCTYPE values [<!ENTITY u "http://e.example/">'
    '<!ENTITY x SYSTEM "file:///etc/passwd">]><values><Server><Id>1</Id><Base-url>&u;&x;&amp;</Base-url>'
    '</Server></values>')
put("server_list_xml", "wrong-root", "<servers>%s</servers>" % server(1, "http://a/"))
put("server_list_xml", "encoding", '<?xml version="1.0" encoding="ISO-8859-1"?><values>'
    + server(1, "http://\xe9.example/") + "</values>")
put("server_list_xml", "not-xml", "Base-url=http://a/")

# --- geocoder_answer ----------------------------------------------------------
def additional(key, value):
    return '<AdditionalData key="%s">%s</AdditionalData>' % (key, value)


put("geocoder_answer", "search", '<?xml version="1.0" encoding="UTF-8"?><ns2:Search xmlns:ns2="http://x">'
    "<Response><View><Result><Location><Address><Label>Seoul</Label>%s%s</Address></Location></Result>"
    "</View></Response></ns2:Search>" % (additional("CountryName", "Korea"), additional("StateName", "Seoul")))
put("geocoder_answer", "search-plain", "<Search><Address>%s%s%s</Address></Search>" % (
    additional("StateName", "Gyeonggi"), additional("CountyName", "Suwon"), additional("CountyName", "Later")))
put("geocoder_answer", "error", '<Error type="PermissionError"><Details>bad app_id</Details></Error>')
put("geocoder_answer", "deep", "<Search>" + "<a>" * 300 + additional("StateName", "Deep") + "</a>" * 300 + "</Search>")
put("geocoder_answer", "entities", '<!DOCTYPE Search [<!ENTITY s "Province"><!ENTITY c "&s;&s;">]>'
    "<Search>%s%s</Search>" % (additional("StateName", "&c;"), additional("CountyName", "a&amp;b&#233;")))
put("geocoder_answer", "no-key", "<Search><AdditionalData>x</AdditionalData><AdditionalData key=''/></Search>")
put("geocoder_answer", "other-root", "<Response/>")
put("geocoder_answer", "not-xml", "<Search")

# --- location_file ------------------------------------------------------------
put("location_file", "stored", '<?xml version="1.0" encoding="UTF-8"?>\n<Location><LatitudeLongitude>'
    "37.500000,127.000000</LatitudeLongitude><City>Suwon</City><Province>Gyeonggi</Province></Location>\n")
put("location_file", "moved", "<Location><LatitudeLongitude>1.000000,2.000000</LatitudeLongitude>"
    "<City>A</City><Province>B</Province></Location>")
put("location_file", "no-position", "<Location><City>A &amp; B</City><Province><![CDATA[<P>]]></Province></Location>")
put("location_file", "empty-city", "<Location><City/><Province>P</Province></Location>")
put("location_file", "wrong-root", "<Place><City>A</City></Place>")
put("location_file", "entities", '<!DOCTYPE Location [<!ENTITY c "City&#233;">]><Location><City>&c;</City>'
    "<Province>&#x10000;</Province></Location>")
put("location_file", "not-xml", "City=Suwon")

# --- response_headers -----------------------------------------------------------
put("response_headers", "ok", 'HTTP/1.1 200 OK\r\nETag: "v1-abc"\r\nCache-Control: public, max-age=3600\r\n'
    "Content-Type: application/json\r\n\r\n")
put("response_headers", "moved", "HTTP/1.1 301 Moved Permanently\r\nLocation: http://moved.example/\r\n\r\n")
put("response_headers", "found-no-slash", "HTTP/1.1 302 Found\r\nLocation: https://other.example\r\n\r\n")
put("response_headers", "relative-location", "HTTP/1.1 302 Found\r\nLocation: /elsewhere/\r\n\r\n")
put("response_headers", "two-answers", "HTTP/1.1 100 Continue\r\n\r\nHTTP/1.1 304 Not Modified\r\n"
    'etag: "lower"\r\nETag: W/"weak"\r\nETag: "later"\r\nCache-Control: max-age=\r\n\r\n')
put("response_headers", "odd-max-age", "Cache-Control: max-age=-5\r\nCache-Control: no-cache max-age=99999999999\n"
    "X-Cache-Control: max-age=0\r\nCache-Control: max-age=12abc")
put("response_headers", "no-line-end", "ETag: unterminated")
put("response_headers", "nul-bytes", b"ETag: a\x00b\r\nLocation: http://\x00/\r\n")

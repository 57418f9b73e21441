#include "Generators.h"

namespace rolvane::test {

namespace {

using rc::gen::inRange;

struct Leaves {
    rc::Gen<std::string> text;
    rc::Gen<Date> date;
    bool absentInArrays;
};

rc::Gen<double> finiteReal() {
    return rc::gen::oneOf(rc::gen::arbitrary<double>(),
                          rc::gen::map(rc::gen::arbitrary<int>(), [](int i) { return static_cast<double>(i); }));
}

Value leaf(const Leaves& leaves) {
    switch (*inRange(0, 6)) {
    case 0: return *rc::gen::arbitrary<bool>();
    case 1: return *rc::gen::arbitrary<int64_t>();
    case 2: return *finiteReal();
    case 3: return *leaves.date;
    case 4: return *rc::gen::arbitrary<Bytes>();
    default: return *leaves.text;
    }
}

Value tree(const Leaves& leaves, int depth) {
    const int kind = depth == 0 ? 0 : *inRange(0, 4);
    if (kind < 2) return leaf(leaves);
    const int n = *inRange(0, 6);
    if (kind == 2) {
        Array a;
        for (int i = 0; i < n; ++i)
            a.append(leaves.absentInArrays && *inRange(0, 8) == 0 ? Value() : tree(leaves, depth - 1));
        return a;
    }
    Dictionary d;
    for (int i = 0; i < n; ++i) d.set(*leaves.text, tree(leaves, depth - 1));
    return d;
}

} // namespace

rc::Gen<std::string> xmlText() {
    const auto piece = rc::gen::element<std::string>(
        "a", "Z", "<", ">", "&", "]]>", "\"", "'", "\n", "\r", "\r\n", "\t", " ", "\x7f", "\xc2\x80", "\xc3\xa9",
        "\xdf\xbf", "\xe0\xa0\x80", "\xe2\x82\xac", "\xed\x9f\xbf", "\xee\x80\x80", "\xef\xbf\xbd", "\xf0\x90\x80\x80",
        "\xf0\x9f\x98\x80", "\xf4\x8f\xbf\xbf", "&amp;");
    return rc::gen::map(rc::gen::container<std::vector<std::string>>(piece), [](const std::vector<std::string>& v) {
        std::string all;
        for (const std::string& s : v) all += s;
        return all;
    });
}

rc::Gen<std::string> anyText() {
    return rc::gen::arbitrary<std::string>();
}

rc::Gen<Value> plistValue() {
    return rc::gen::exec([] {
        const auto date = rc::gen::map(inRange<int64_t>(-62135596800, 253402300800),
                                       [](int64_t s) { return Date(static_cast<double>(s)); });
        return tree({xmlText(), date, false}, 3);
    });
}

rc::Gen<Value> anyValue() {
    return rc::gen::exec([] {
        const auto date = rc::gen::map(rc::gen::arbitrary<double>(), [](double s) { return Date(s); });
        return tree({anyText(), date, true}, 3);
    });
}

} // namespace rolvane::test

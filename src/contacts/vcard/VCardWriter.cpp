#include "contacts/vcard/VCardWriter.h"

#include "contacts/records/CXMultiValue.h"
#include "contacts/records/Constants.h"
#include "contacts/vcard/VCardFields.h"
#include "contacts/vcard/VCardKept.h"
#include "contacts/vcard/VCardLabels.h"
#include "contacts/vcard/VCardText.h"
#include "foundation/PropertyList.h"

#include <algorithm>
#include <map>
#include <set>
#include <unordered_map>
#include <utility>

namespace rolvane {

namespace {

// Version 3.0 has no groups. These lines are what phones and other address books write and understand instead.
constexpr const char* kGroupKind3 = "X-ADDRESSBOOKSERVER-KIND";
constexpr const char* kGroupMember3 = "X-ADDRESSBOOKSERVER-MEMBER";

// In the order in which a person expects to see them.
constexpr const char* kMultiOrder[] = {kCXPhoneProperty,     kCXEmailProperty,          kCXAddressProperty,
                                       kCXURLsProperty,      kCXInstantMessageProperty, kCXRelatedNamesProperty,
                                       kCXOtherDatesProperty};

constexpr const char* kTextOrder[] = {
    kCXJobTitleProperty,           kCXNoteProperty,
    kCXMaidenNameProperty,         kCXFirstNamePhoneticProperty,
    kCXMiddleNamePhoneticProperty, kCXLastNamePhoneticProperty,
};

constexpr int kNoPreference = 1000;

bool sameProperty(const Value& a, const Value& b) {
    auto ma = CXMultiValue::fromValue(a), mb = CXMultiValue::fromValue(b);
    return ma && mb ? ma->sameContents(*mb) : a == b;
}

class Writer {
public:
    Writer(const VCardEntity& entity, VCardVersion version)
        : _entity(entity), _p(entity.properties), _v4(version == VCardVersion::v4) {}

    std::string text() {
        readExtras();
        int times = 0;
        do {
            compose();
            readBack();
        } while (wrapWhatMeansSomethingElse(++times >= kMostTimes));
        writeInexact();
        std::string out = "BEGIN:VCARD\r\nVERSION:";
        out += _v4 ? "4.0\r\n" : "3.0\r\n";
        for (const auto& line : _lines) vcardAppendFolded(out, vcardFormatLine(line));
        return out += "END:VCARD\r\n";
    }

private:
    // One line that is out of the way may leave its meaning to the next: in the end all kept lines go out of the way.
    static constexpr int kMostTimes = 3;

    struct Carrier {
        VCardLine line;
        std::string label;
    };
    struct Alike { // carriers of one name, value and label; each serves one line
        std::vector<const Carrier*> all;
        size_t next = 0;
    };

    void compose() {
        _lines.clear();
        for (auto& [key, alike] : _alike) alike.next = 0;
        _labelled.clear();
        _groupCount = 0;
        _anniversary = false;
        if (_entity.isGroup)
            writeGroup();
        else
            writePerson();
        for (const auto& line : _plain) {
            auto written = _wrapped.count(line.name) ? std::nullopt : formOf(line);
            if (written)
                emit(std::move(*written));
            else
                emit("X-ROLVANE-KEPT", vcardEscape(vcardFormatLine(line)));
        }
    }

    // Nothing for a line that this version does not have.
    std::optional<VCardLine> formOf(const VCardLine& kept) const {
        if (kept.name == "UID" || kept.name.starts_with("X-")) return kept;
        return vcardKeptLineFor(kept, _v4);
    }

    void readBack() {
        VCard card;
        for (const auto& line : _lines) {
            auto again = vcardParseLine(vcardFormatLine(line));
            if (again) card.lines.push_back(std::move(*again));
        }
        VCardError error;
        _back = vcardEntityFromCard(card, error);
    }

    // A kept line may stand beside a property that is no longer there, and would be taken for it. Such lines go inside
    // an X-ROLVANE-KEPT, all of a name together, or `all` that there are. True when the text must be made anew.
    bool wrapWhatMeansSomethingElse(bool all) {
        if (_plain.empty()) return false;
        std::multiset<std::string> kept;
        bool readable = _back && _back->isGroup == _entity.isGroup;
        if (const Array* extras = readable ? _back->properties[kCXVCardExtraProperty].arrayIf() : nullptr)
            for (const auto& e : *extras) kept.insert(e.string());
        size_t before = _wrapped.size();
        for (const auto& line : _plain) {
            auto found = kept.find(vcardFormatLine(line));
            if (found != kept.end())
                kept.erase(found);
            else if (line.name != "UID" && line.name != "X-ROLVANE-KEPT")
                _wrapped.insert(line.name);
        }
        if (_wrapped.size() == before) return false;
        for (const auto& line : _plain)
            if (all && line.name != "UID" && line.name != "X-ROLVANE-KEPT") _wrapped.insert(line.name);
        return true;
    }

    void readExtras() {
        const Array* extras = _p[kCXVCardExtraProperty].arrayIf();
        for (size_t i = 0; extras && i < extras->count(); i++) {
            std::string text = (*extras)[i].string();
            bool carrier = text.starts_with('+');
            if (!vcardIsPlainText(text)) continue;
            auto line = vcardParseLine(carrier ? std::string_view(text).substr(1) : std::string_view(text));
            bool structural = line && (line->name == "BEGIN" || line->name == "END" || line->name == "VERSION");
            if (!line || structural) continue;
            if (!line->group.empty()) _groupNames.insert(line->group);
            if (!carrier) {
                // A card has one UID, and one that can be read.
                if (line->name == "UID" && (line->isStillEncoded() || std::exchange(_uidKept, true))) continue;
                if (vcardIsLabelLine(*line)) _labelledBesides.insert(line->group);
                if (line->isStillEncoded()) _wrapped.insert(line->name);
                auto kept = vcardKeptForm(*line); // earlier versions kept lines as they came
                if (!kept) {
                    VCardLine unread;
                    unread.name = kVCardUnreadLine;
                    unread.value = vcardEscape(vcardFormatLine(*line));
                    kept = std::move(unread);
                }
                _plain.push_back(std::move(*kept));
                continue;
            }
            std::string label = line->firstValueOf("X-ROLVANE-LABEL");
            std::erase_if(line->parameters, [](const VCardParameter& p) { return p.name == "X-ROLVANE-LABEL"; });
            _carriers.push_back({std::move(*line), std::move(label)});
        }
        // Of equal entries the preferred one comes first.
        std::stable_sort(_carriers.begin(), _carriers.end(), [](const Carrier& a, const Carrier& b) {
            return preferenceOf(a.line) < preferenceOf(b.line);
        });
        for (const auto& c : _carriers) {
            if (c.line.name == "CATEGORIES")
                for (const auto& name : vcardDecodeList(c.line)) _ofCategory.emplace(name, &c);
            _alike[keyOf(c.line.name, c.line.value, c.label)].all.push_back(&c);
        }
    }

    static std::string keyOf(std::string_view name, std::string_view value, std::string_view label) {
        std::string key(name); // no line has a line feed in it
        return key.append("\n").append(label).append("\n").append(value);
    }

    static int preferenceOf(const VCardLine& line) {
        const VCardParameter* p = line.parameter("PREF");
        return !p || p->values.empty() ? kNoPreference : std::atoi(p->values.front().c_str());
    }

    void emit(VCardLine line) { _lines.push_back(std::move(line)); }

    void emit(const char* name, std::string raw) {
        VCardLine line;
        line.name = name;
        line.value = std::move(raw);
        emit(std::move(line));
    }

    // A line of which a card has one, with the parameters that it came with.
    void emitSingle(const char* name, bool evenEmpty = false) {
        VCardLine line = single(name);
        if (evenEmpty || !line.value.empty()) emit(std::move(line));
    }

    VCardLine single(const char* name) {
        VCardLine line;
        line.name = name;
        line.value = vcardEncodeSingle(name, _p, _entity.isGroup);
        if (const Carrier* c = carrierFor(line.name, line.value, "")) take(*c, line);
        return line;
    }

    void emitKind() {
        VCardLine line = single("KIND");
        const bool plain = line.group.empty() && line.parameters.empty();
        line.name = _v4 ? "KIND" : _entity.isGroup ? kGroupKind3 : "X-ROLVANE-KIND";
        if (line.value != "individual" || !plain) emit(std::move(line));
    }

    void emitMember(const char* name, const std::string& uid) {
        VCardLine line;
        line.name = name;
        line.value = vcardEscape(uid);
        if (const Carrier* c = carrierFor("MEMBER", vcardMemberKey(uid), "")) take(*c, line);
        emit(std::move(line));
    }

    static void take(const Carrier& carrier, VCardLine& line) {
        line.group = carrier.line.group;
        line.parameters = carrier.line.parameters;
        if (line.parameter("X-ROLVANE-RAW")) {
            line.value = line.firstValueOf("X-ROLVANE-RAW");
            std::erase_if(line.parameters, [](const VCardParameter& p) { return p.name == "X-ROLVANE-RAW"; });
        }
        const VCardParameter* rest = line.parameter("X-ROLVANE-REST");
        if (!rest) return;
        line.value += ';' + line.firstValueOf("X-ROLVANE-REST");
        std::erase_if(line.parameters, [](const VCardParameter& p) { return p.name == "X-ROLVANE-REST"; });
    }

    const Carrier* carrierFor(std::string_view name, std::string_view value, std::string_view label) {
        const auto found = _alike.find(keyOf(name, value, label));
        if (found == _alike.end() || found->second.next == found->second.all.size()) return nullptr;
        return found->second.all[found->second.next++];
    }

    std::string plain(std::string_view property) const {
        const Value& v = _p[property];
        return v.isString() && vcardIsPlainText(v.string()) ? v.string() : std::string();
    }

    void emitUID() {
        if (!_uidKept && !_entity.uid.empty()) emit("UID", vcardEscape(_entity.uid));
    }

    void emitCategories() {
        std::vector<std::string> names;
        if (const Array* own = _p[kCXCategoriesProperty].arrayIf())
            for (const auto& v : *own) names.push_back(v.string());
        names.insert(names.end(), _entity.categories.begin(), _entity.categories.end());
        // In their order, but those that stood in one line with parameters go together.
        std::vector<std::pair<const Carrier*, std::vector<std::string>>> lines;
        std::map<const Carrier*, size_t> placeOf;
        std::set<std::string> seen;
        for (const auto& n : names) {
            if (n.empty() || !vcardIsPlainText(n) || !seen.insert(n).second) continue;
            const auto carried = _ofCategory.find(n);
            const Carrier* carrier = carried == _ofCategory.end() ? nullptr : carried->second;
            const bool goesOn = !carrier && !lines.empty() && !lines.back().first;
            size_t place = goesOn ? lines.size() - 1 : lines.size();
            if (carrier) place = placeOf.emplace(carrier, place).first->second;
            if (place == lines.size()) lines.push_back({carrier, {}});
            lines[place].second.push_back(n);
        }
        for (const auto& [carrier, ofLine] : lines) {
            VCardLine line;
            line.name = "CATEGORIES";
            line.value = vcardEncodeList(ofLine);
            if (carrier) take(*carrier, line);
            emit(std::move(line));
        }
    }

    void writePerson() {
        emitUID();
        emitKind();
        emitSingle("FN", true);
        VCardLine name = single("N");
        if (name.value.empty() && !_v4) name.value = ";;;;";
        if (!name.value.empty()) emit(std::move(name));
        emitSingle("NICKNAME");
        emitSingle("ORG");
        for (const char* property : kMultiOrder) writeMulti(property);
        writeBirthday();
        std::string homePage = plain(kCXHomePageProperty);
        if (!homePage.empty()) {
            VCardLine line;
            line.name = "URL";
            line.add("X-ROLVANE-HOMEPAGE", "1");
            line.value = vcardEncodeURI(homePage);
            emit(std::move(line));
        }
        for (const char* property : kTextOrder) emitSingle(vcardLineForTextProperty(property));
        emitCategories();
        writePhoto();
    }

    void writeBirthday() {
        VCardLine line = single("BDAY");
        if (auto date = _p[kCXBirthdayProperty].date()) {
            line.value = vcardEncodeDate(*date, _v4);
            // Where the year is a filling, 4.0 leaves it out.
            const int filling = vcardOmittedYear(line);
            const bool omitted = _v4 && filling > 0 && line.value.size() == 8;
            if (omitted && std::atoi(line.value.substr(0, 4).c_str()) == filling) line.value.replace(0, 4, "--");
        } else if (!vcardIsTruncatedDate(line.value)) {
            line.add("VALUE", "text");
        }
        if (!line.value.empty()) emit(std::move(line));
    }

    void writePhoto() {
        const Bytes& bytes = _p[kCXPhotoProperty].data();
        if (bytes.empty()) return;
        std::string type = plain(kCXPhotoTypeProperty);
        bool usable = type.find('/') != std::string::npos && type.find_first_of(" ;,:\"\t\n\\") == std::string::npos;
        VCardLine line = vcardEncodePhoto({bytes, usable ? type : std::string()}, _v4);
        bool parameters =
            std::any_of(_carriers.begin(), _carriers.end(), [](const auto& c) { return c.line.name == "PHOTO"; });
        if (parameters) {
            VCardLine known = single("PHOTO");
            line.group = known.group;
            line.parameters.insert(line.parameters.end(), known.parameters.begin(), known.parameters.end());
        }
        emit(std::move(line));
    }

    void writeMulti(const char* property) {
        auto multi = CXMultiValue::fromValue(_p[property]);
        if (!multi) return;
        const VCardMultiField* field = vcardMultiFieldForProperty(property);
        int preference = 0; // entries are read in the order of their preference, so it may only grow
        for (const auto& entry : multi->entries()) writeEntry(*field, entry, preference);
    }

    void writeEntry(const VCardMultiField& field, const CXMultiValue::Entry& entry, int& preference) {
        auto raw = vcardEncodeMultiValue(field.property, entry.value);
        if (!raw || !vcardIsPlainText(entry.label)) return; // writeInexact sees to it
        VCardLine line;
        line.name = field.lineName;
        line.value = *raw;
        const Carrier* carrier = carrierFor(line.name, line.value, entry.label);
        if (carrier) {
            take(*carrier, line);
        } else {
            for (auto& t : vcardTypesForLabel(field.lineName, entry.label)) line.add("TYPE", t);
        }
        placePreference(line, preference);
        if (field.property == std::string_view(kCXAddressProperty)) {
            std::string code = entry.value.dictionary()[kCXAddressCountryCodeKey].string();
            if (!code.empty()) line.add("CC", code);
        }
        nameFor(line, field, entry);
        bool saidByName = line.name.ends_with("ANNIVERSARY");
        bool needsLabel = line.name.starts_with("X-AB") && !entry.label.empty();
        bool saidByTypes = !needsLabel && vcardLabelForTypes(field.lineName, line.types()) == entry.label;
        bool related = line.name == "RELATED";
        if (related) line.parameters.insert(line.parameters.begin(), {"VALUE", {"text"}});
        // Another label of the group must not be taken for this one.
        bool contested = !line.group.empty() && _labelledBesides.count(line.group);
        if ((saidByName || saidByTypes) && !contested) return emit(std::move(line));
        if (line.group.empty()) line.group = freshGroup();
        if (!_labelled.insert(line.group).second) return emit(std::move(line));
        VCardLine label;
        label.group = line.group;
        const auto text = vcardTextForLabel(entry.label);
        label.name = text ? "X-ABLabel" : "X-ROLVANE-LABEL"; // spelt as programs do that mind the case
        label.value = vcardEscape(text ? *text : entry.label);
        emit(std::move(line));
        emit(std::move(label));
    }

    // Dates and relations that a version has no property for are written as address books of telephones do.
    void nameFor(VCardLine& line, const VCardMultiField& field, const CXMultiValue::Entry& entry) {
        const bool isDate = field.property == std::string_view(kCXOtherDatesProperty);
        const bool together = !line.group.empty(); // with lines that a label would name, too
        if (isDate && _v4 && entry.label == kCXAnniversaryLabel && !std::exchange(_anniversary, true)) {
            line.name = "ANNIVERSARY";
        } else if (isDate && together && entry.label == kCXAnniversaryLabel) {
            line.name = "X-ANNIVERSARY";
        } else if (isDate) {
            line.name = "X-ABDATE";
            line.value = vcardEncodeDate(*entry.value.date(), false);
        } else if (!_v4 && !together && line.name == "RELATED" && vcardTextForLabel(entry.label)) {
            line.name = "X-ABRELATEDNAMES";
        } else if (_v4 ? !field.inVersion4 : !field.inVersion3) {
            line.name = std::string("X-ROLVANE-") + field.lineName;
        }
    }

    // PREF=1 of 4.0 is TYPE=pref in 3.0. A preference that contradicts the order is not written.
    void placePreference(VCardLine& line, int& preference) const {
        auto p = std::find_if(line.parameters.begin(), line.parameters.end(),
                              [](const auto& q) { return q.name == "PREF"; });
        int own = preferenceOf(line);
        bool fits = own >= preference;
        preference = fits ? own : kNoPreference;
        if (own == kNoPreference) return;
        if (!fits || (!_v4 && own == 1)) line.parameters.erase(p);
        if (fits && !_v4 && own == 1) line.add("TYPE", "pref");
    }

    std::string freshGroup() {
        std::string name;
        do name = "item" + std::to_string(++_groupCount);
        while (_groupNames.count(name));
        return name;
    }

    void writeGroup() {
        emitUID();
        emitKind();
        emitSingle("FN", true);
        if (!_v4) emit("N", vcardEncodeSingle("FN", _p, true) + ";;;;");
        emitSingle("NOTE");
        for (const auto& m : _entity.members) emitMember(_v4 ? "MEMBER" : kGroupMember3, m);
        for (const auto& g : _entity.subgroups) emitMember("X-ROLVANE-SUBGROUP", g);
        for (const auto& c : _entity.choices) {
            VCardLine line;
            line.name = "X-ROLVANE-CHOICE";
            line.add("X-MEMBER", c.member);
            line.add("X-PROPERTY", c.property);
            if (!c.label.empty()) line.add("X-LABEL", c.label);
            line.value = c.raw;
            emit(std::move(line));
        }
    }

    // Adds the exact value of every property that does not come back as it is.
    void writeInexact() {
        Dictionary back = _back ? _back->properties : Dictionary();
        std::set<std::string> names;
        for (const auto& [key, value] : _p)
            if (!sameProperty(value, back[key])) names.insert(key);
        for (const auto& [key, value] : back)
            if (!_p[key]) names.insert(key);
        for (const auto& name : names) {
            if (vcardIsNeverExact(name) || !vcardIsPlainText(name)) continue;
            VCardLine line;
            line.name = "X-ROLVANE-VALUE";
            line.add("X-NAME", name);
            if (_p[name]) line.value = vcardEncodeBase64(BinaryValue::encode(_p[name]));
            emit(std::move(line));
        }
    }

    const VCardEntity& _entity;
    const Dictionary& _p;
    bool _v4;
    std::vector<VCardLine> _lines, _plain;
    std::vector<Carrier> _carriers;
    std::unordered_map<std::string, Alike> _alike;     // by keyOf
    std::map<std::string, const Carrier*> _ofCategory; // by a name in it
    std::set<std::string> _groupNames;
    std::set<std::string> _labelledBesides; // groups with a kept line that would label them
    std::set<std::string> _labelled;        // groups whose label is written
    std::set<std::string> _wrapped;         // names of the kept lines that cannot stand for themselves
    std::optional<VCardEntity> _back;       // the lines as they read again
    int _groupCount = 0;
    bool _uidKept = false, _anniversary = false;
};

} // namespace

std::string vcardText(const VCardEntity& entity, VCardVersion version) {
    return Writer(entity, version).text();
}

} // namespace rolvane

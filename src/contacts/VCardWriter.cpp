#include "contacts/VCardWriter.h"

#include "contacts/CXMultiValue.h"
#include "contacts/Constants.h"
#include "contacts/VCardFields.h"
#include "contacts/VCardLabels.h"
#include "contacts/VCardText.h"
#include "foundation/PropertyList.h"

#include <algorithm>
#include <set>

namespace rolvane {

namespace {

// In the order in which a person expects to see them.
constexpr const char* kMultiOrder[] = {kCXPhoneProperty,     kCXEmailProperty,          kCXAddressProperty,
                                       kCXURLsProperty,      kCXInstantMessageProperty, kCXRelatedNamesProperty,
                                       kCXOtherDatesProperty};

constexpr std::pair<const char*, const char*> kTextLines[] = {
    {"TITLE", kCXJobTitleProperty},
    {"NOTE", kCXNoteProperty},
    {"X-ROLVANE-MAIDEN-NAME", kCXMaidenNameProperty},
    {"X-ROLVANE-PHONETIC-FIRST", kCXFirstNamePhoneticProperty},
    {"X-ROLVANE-PHONETIC-MIDDLE", kCXMiddleNamePhoneticProperty},
    {"X-ROLVANE-PHONETIC-LAST", kCXLastNamePhoneticProperty},
};

// Never compared, because they are written by rules of their own, or never written at all.
bool isOutsideTheCheck(std::string_view property) {
    for (auto p :
         {kCXVCardExtraProperty, kCXCategoriesProperty, kCXRemoteLocationProperty, kCXReadSharingACLProperty,
          kCXReadWriteSharingACLProperty, kCXUIDProperty, kCXCreationDateProperty, kCXModificationDateProperty})
        if (property == p) return true;
    return false;
}

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
        if (_entity.isGroup)
            writeGroup();
        else
            writePerson();
        for (const auto& line : _plain) emit(line);
        writeInexact();
        std::string out = "BEGIN:VCARD\r\nVERSION:";
        out += _v4 ? "4.0\r\n" : "3.0\r\n";
        for (const auto& line : _lines) vcardAppendFolded(out, vcardFormatLine(line));
        return out += "END:VCARD\r\n";
    }

private:
    struct Carrier {
        VCardLine line;
        std::string label;
        bool used = false;
    };

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
                if (line->name == "UID") _uidKept = true;
                _plain.push_back(std::move(*line));
                continue;
            }
            std::string label = line->firstValueOf("X-ROLVANE-LABEL");
            std::erase_if(line->parameters, [](const VCardParameter& p) { return p.name == "X-ROLVANE-LABEL"; });
            _carriers.push_back({std::move(*line), std::move(label), false});
        }
    }

    void emit(VCardLine line) { _lines.push_back(std::move(line)); }

    void emit(const char* name, std::string raw) {
        VCardLine line;
        line.name = name;
        line.value = std::move(raw);
        emit(std::move(line));
    }

    // A line of which a person has one, with the parameters that it came with.
    void emitSingle(const char* name, std::string raw) {
        VCardLine line;
        line.name = name;
        line.value = std::move(raw);
        if (Carrier* c = carrierFor(line, "")) {
            line.parameters = c->line.parameters;
            line.group = c->line.group;
        }
        emit(std::move(line));
    }

    Carrier* carrierFor(const VCardLine& line, const std::string& label) {
        for (auto& c : _carriers) {
            if (c.used || c.line.name != line.name || c.line.value != line.value || c.label != label) continue;
            c.used = true;
            return &c;
        }
        return nullptr;
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
        std::vector<std::string> once;
        for (const auto& n : names)
            if (!n.empty() && vcardIsPlainText(n) && std::find(once.begin(), once.end(), n) == once.end())
                once.push_back(n);
        if (!once.empty()) emit("CATEGORIES", vcardEncodeList(once));
    }

    void writePerson() {
        emitUID();
        if (_p[kCXIsCompanyProperty].boolean()) emit(_v4 ? "KIND" : "X-ROLVANE-KIND", "org");
        std::string formatted = plain(kCXFormattedNameProperty);
        emitSingle("FN", vcardEscape(formatted.empty() ? vcardDerivedFormattedName(_p) : formatted));
        std::string name = vcardEncodeName(_p);
        if (!_v4 || name != ";;;;") emitSingle("N", name);
        std::string nickname = plain(kCXNicknameProperty);
        if (!nickname.empty()) emitSingle("NICKNAME", encodeNickname(nickname));
        std::string organization = vcardEncodeOrganization(_p);
        if (!organization.empty()) emitSingle("ORG", organization);
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
        for (const auto& [lineName, property] : kTextLines) {
            std::string text = plain(property);
            if (!text.empty()) emitSingle(lineName, vcardEscape(text));
        }
        emitCategories();
        writePhoto();
    }

    static std::string encodeNickname(const std::string& nickname) {
        std::vector<std::string> items;
        for (size_t start = 0; start != std::string::npos;) {
            size_t end = nickname.find(", ", start);
            items.push_back(nickname.substr(start, end == std::string::npos ? end : end - start));
            start = end == std::string::npos ? end : end + 2;
        }
        return vcardEncodeList(items);
    }

    void writeBirthday() {
        VCardLine line;
        line.name = "BDAY";
        if (auto date = _p[kCXBirthdayProperty].date()) {
            line.value = vcardEncodeDate(*date, _v4);
        } else {
            std::string text = plain(kCXBirthdayTextProperty);
            if (!_v4 || !vcardIsTruncatedDate(text)) line.add("VALUE", "text");
            line.value = vcardEscape(text);
        }
        if (!line.value.empty()) emit(std::move(line));
    }

    void writePhoto() {
        const Bytes& bytes = _p[kCXPhotoProperty].data();
        if (bytes.empty()) return;
        std::string type = plain(kCXPhotoTypeProperty);
        bool usable = type.find('/') != std::string::npos && type.find_first_of(" ;,:\"\t\n\\") == std::string::npos;
        emit(vcardEncodePhoto({bytes, usable ? type : std::string()}, _v4));
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
        const Carrier* carrier = carrierFor(line, entry.label);
        if (carrier) {
            line.parameters = carrier->line.parameters;
            line.group = carrier->line.group;
        } else {
            for (auto& t : vcardTypesForLabel(field.lineName, entry.label)) line.add("TYPE", t);
            if (field.lineName == std::string_view("EMAIL") && !_v4) line.add("TYPE", "internet");
        }
        placePreference(line, preference);
        if (field.property == std::string_view(kCXAddressProperty)) {
            std::string code = entry.value.dictionary()[kCXAddressCountryCodeKey].string();
            if (!code.empty()) line.add("CC", code);
        }
        nameFor(line, field, entry.label);
        bool saidByName = line.name == "ANNIVERSARY";
        bool saidByTypes = vcardLabelForTypes(field.lineName, line.types()) == entry.label;
        bool related = line.name == "RELATED";
        if (related) line.parameters.insert(line.parameters.begin(), {"VALUE", {"text"}});
        if (saidByName || saidByTypes) return emit(std::move(line));
        if (line.group.empty()) line.group = freshGroup();
        VCardLine label;
        label.group = line.group;
        label.name = "X-ROLVANE-LABEL";
        label.value = vcardEscape(entry.label);
        emit(std::move(line));
        emit(std::move(label));
    }

    void nameFor(VCardLine& line, const VCardMultiField& field, const std::string& label) {
        bool anniversary = field.property == std::string_view(kCXOtherDatesProperty) && label == kCXAnniversaryLabel;
        if (anniversary && _v4 && !_anniversary) {
            line.name = "ANNIVERSARY";
            _anniversary = true;
        } else if (_v4 ? !field.inVersion4 : !field.inVersion3) {
            line.name = std::string("X-ROLVANE-") + field.lineName;
        }
    }

    // PREF=1 of 4.0 is TYPE=pref in 3.0. A preference that contradicts the order is not written.
    void placePreference(VCardLine& line, int& preference) const {
        auto p = std::find_if(line.parameters.begin(), line.parameters.end(),
                              [](const auto& q) { return q.name == "PREF"; });
        int own = p == line.parameters.end() || p->values.empty() ? 1000 : std::atoi(p->values.front().c_str());
        bool fits = own >= preference;
        preference = fits ? own : 1000;
        if (own == 1000) return;
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
        emit(_v4 ? "KIND" : "X-ROLVANE-KIND", "group");
        std::string name = vcardEscape(plain(kCXGroupNameProperty));
        emit("FN", name);
        if (!_v4) emit("N", name + ";;;;");
        std::string note = plain(kCXNoteProperty);
        if (!note.empty()) emitSingle("NOTE", vcardEscape(note));
        for (const auto& m : _entity.members) emit(_v4 ? "MEMBER" : "X-ROLVANE-MEMBER", vcardEscape(m));
        for (const auto& g : _entity.subgroups) emit("X-ROLVANE-SUBGROUP", vcardEscape(g));
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

    // Reads what has been written, and adds the exact value of every property that would not come back as it is.
    void writeInexact() {
        VCard card;
        for (const auto& line : _lines) {
            auto again = vcardParseLine(vcardFormatLine(line));
            if (again) card.lines.push_back(std::move(*again));
        }
        VCardError error;
        auto again = vcardEntityFromCard(card, error);
        Dictionary back = again ? again->properties : Dictionary();
        std::set<std::string> names;
        for (const auto& [key, value] : _p)
            if (!sameProperty(value, back[key])) names.insert(key);
        for (const auto& [key, value] : back)
            if (!_p[key]) names.insert(key);
        for (const auto& name : names) {
            if (isOutsideTheCheck(name) || !vcardIsPlainText(name)) continue;
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
    std::set<std::string> _groupNames;
    int _groupCount = 0;
    bool _uidKept = false, _anniversary = false;
};

} // namespace

std::string vcardText(const VCardEntity& entity, VCardVersion version) {
    return Writer(entity, version).text();
}

} // namespace rolvane

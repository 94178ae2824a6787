// Language identification of short queries, as a look-up sends them ("qlang"): accuracy on a
// labelled set of 112 queries of one to six words in 13 languages written in Latin or Cyrillic
// letters (the scripts that name no language), and time per call. Compared: CLD2 as the daemon
// calls it (no answer unless confident), CLD2 asked for its best effort, and libexttextcat with
// its stock fingerprints (when built with it). The counters: "correct", "unknown" (no answer)
// and "wrong", each a share of the set.
#include <benchmark/benchmark.h>
#include <cld2/internal/lang_script.h>
#include <cld2/public/compact_lang_det.h>
#include <cld2/public/encodings.h>

#include <cstring>
#include <functional>
#include <string>

#include "network/language_identifier.h"

#ifdef TAVIX_BENCH_EXTTEXTCAT
#include <libexttextcat/textcat.h>
#endif

namespace {

struct Labelled {
  const char* language;
  const char* text;
};

const Labelled kQueries[] = {
    {"en", "weather tomorrow"}, {"en", "cheap flights to london"}, {"en", "how to cook rice"},
    {"en", "nearest coffee shop"}, {"en", "football scores"}, {"en", "movie times tonight"},
    {"en", "what is the capital of australia"}, {"en", "best running shoes"},
    {"fr", "météo demain"}, {"fr", "billets de train pas cher"}, {"fr", "recette de la tarte aux pommes"},
    {"fr", "pharmacie de garde"}, {"fr", "horaires du cinéma"}, {"fr", "où est la gare"},
    {"fr", "traduction anglais français"}, {"fr", "prix de l'essence aujourd'hui"},
    {"de", "wetter morgen"}, {"de", "günstige flüge nach berlin"}, {"de", "wie koche ich reis"},
    {"de", "apotheke in der nähe"}, {"de", "öffnungszeiten rathaus"}, {"de", "bundesliga ergebnisse heute"},
    {"de", "rezept für apfelkuchen"}, {"de", "zugverbindung nach münchen"},
    {"es", "tiempo mañana"}, {"es", "vuelos baratos a madrid"}, {"es", "receta de paella valenciana"},
    {"es", "farmacia de guardia"}, {"es", "cómo hacer pan casero"}, {"es", "resultados de fútbol"},
    {"es", "horario del museo del prado"}, {"es", "dónde está la estación"},
    {"it", "previsioni meteo domani"}, {"it", "voli economici per roma"}, {"it", "ricetta della carbonara"},
    {"it", "farmacia di turno"}, {"it", "orari dei treni"}, {"it", "risultati serie a"},
    {"it", "come si dice grazie"}, {"it", "ristoranti vicino a me"},
    {"pt", "previsão do tempo amanhã"}, {"pt", "voos baratos para lisboa"}, {"pt", "receita de bolo de cenoura"},
    {"pt", "farmácia aberta agora"}, {"pt", "horário dos comboios"}, {"pt", "resultados do futebol"},
    {"pt", "como fazer pão"}, {"pt", "onde fica a estação"},
    {"nl", "weer morgen"}, {"nl", "goedkope vluchten naar amsterdam"}, {"nl", "recept voor appeltaart"},
    {"nl", "apotheek in de buurt"}, {"nl", "openingstijden gemeentehuis"}, {"nl", "uitslagen eredivisie"},
    {"nl", "hoe laat is het"}, {"nl", "treinen naar utrecht"},
    {"sv", "väder imorgon"}, {"sv", "billiga flyg till stockholm"}, {"sv", "recept på kanelbullar"},
    {"sv", "apotek i närheten"}, {"sv", "öppettider systembolaget"}, {"sv", "tåg till göteborg"},
    {"sv", "hur lagar man ris"}, {"sv", "resultat allsvenskan"},
    {"pl", "pogoda jutro"}, {"pl", "tanie loty do krakowa"}, {"pl", "przepis na pierogi"},
    {"pl", "apteka w pobliżu"}, {"pl", "godziny otwarcia urzędu"}, {"pl", "wyniki meczów"},
    {"pl", "jak ugotować ryż"}, {"pl", "pociągi do warszawy"},
    {"tr", "yarın hava durumu"}, {"tr", "istanbul ucuz uçak bileti"}, {"tr", "mercimek çorbası tarifi"},
    {"tr", "nöbetçi eczane"}, {"tr", "maç sonuçları"}, {"tr", "en yakın restoran"},
    {"tr", "pilav nasıl yapılır"}, {"tr", "ankara otobüs saatleri"},
    {"ru", "погода на завтра"}, {"ru", "дешевые авиабилеты в москву"}, {"ru", "рецепт борща"},
    {"ru", "аптека рядом"}, {"ru", "расписание электричек"}, {"ru", "результаты футбола"},
    {"ru", "как сварить рис"}, {"ru", "курс доллара сегодня"},
    {"uk", "погода на завтра у києві"}, {"uk", "дешеві квитки до львова"}, {"uk", "рецепт вареників"},
    {"uk", "аптека поруч"}, {"uk", "розклад потягів"}, {"uk", "як зварити рис"},
    {"uk", "новини україни"}, {"uk", "курс гривні сьогодні"},
    {"cs", "počasí zítra"}, {"cs", "levné letenky do prahy"}, {"cs", "recept na svíčkovou"},
    {"cs", "lékárna v okolí"}, {"cs", "jízdní řády vlaků"}, {"cs", "výsledky fotbalu"},
    {"cs", "jak uvařit rýži"}, {"cs", "otevírací doba pošty"},
    {"en", "paris"}, {"en", "translate"}, {"fr", "boulangerie"}, {"de", "fahrplan"},
    {"es", "biblioteca"}, {"it", "spiaggia"}, {"ru", "москва"}, {"pl", "kraków"},
};

using Identify = std::function<std::string(const char*)>;

void run(benchmark::State& state, const Identify& identify) {
  int correct = 0, unknown = 0, wrong = 0;
  for (const auto& q : kQueries) {
    const std::string guess = identify(q.text);
    if (guess.empty()) ++unknown;
    else if (guess == q.language) ++correct;
    else ++wrong;
  }
  std::size_t i = 0;
  for (auto _ : state) {
    benchmark::DoNotOptimize(identify(kQueries[i].text));
    if (++i == std::size(kQueries)) i = 0;
  }
  const double n = static_cast<double>(std::size(kQueries));
  state.counters["correct"] = correct / n;
  state.counters["unknown"] = unknown / n;
  state.counters["wrong"] = wrong / n;
}

std::string cld2(const char* text, int flags) {
  CLD2::CLDHints hints{nullptr, nullptr, CLD2::UNKNOWN_ENCODING, CLD2::UNKNOWN_LANGUAGE};
  CLD2::Language top3[3];
  int percent3[3], textBytes = 0;
  double scores3[3];
  bool reliable = false;
  const auto language = CLD2::ExtDetectLanguageSummary(text, static_cast<int>(std::strlen(text)), true, &hints,
                                                       flags, top3, percent3, scores3, nullptr, &textBytes,
                                                       &reliable);
  return language == CLD2::UNKNOWN_LANGUAGE ? std::string() : CLD2::LanguageCode(language);
}

void BM_Daemon(benchmark::State& state) {
  run(state, [](const char* text) { return tavix::TVXLanguageForString(text).value_or(""); });
}
BENCHMARK(BM_Daemon);

void BM_CLD2BestEffort(benchmark::State& state) {
  run(state, [](const char* text) { return cld2(text, CLD2::kCLDFlagBestEffort); });
}
BENCHMARK(BM_CLD2BestEffort);

#ifdef TAVIX_BENCH_EXTTEXTCAT
void BM_Exttextcat(benchmark::State& state) {
  void* handle = special_textcat_Init(TAVIX_BENCH_EXTTEXTCAT_DATA "fpdb.conf", TAVIX_BENCH_EXTTEXTCAT_DATA);
  if (!handle) {
    state.SkipWithError("no libexttextcat fingerprints");
    return;
  }
  run(state, [handle](const char* text) {
    // "[fr--utf8][ca--utf8]", "UNKNOWN" or "SHORT": the first candidate's language.
    const std::string answer = textcat_Classify(handle, text, std::strlen(text));
    if (answer.empty() || answer.front() != '[') return std::string();
    return answer.substr(1, answer.find_first_of("-]") - 1);
  });
  textcat_Done(handle);
}
BENCHMARK(BM_Exttextcat);
#endif

}  // namespace

BENCHMARK_MAIN();

// The command lines of sxreportingd, sxreportctl and sxreport-bench, parsed by CLI11 set up
// alike: their --help reads the same way (help2man makes the manual pages from it) and a bad
// option or value is one line naming the option, with exit status 2. Header-only: the client
// library is built from this folder's sources and must not ship any of it.
#pragma once

#include <CLI/CLI.hpp>
#include <algorithm>
#include <cctype>
#include <charconv>
#include <cstdio>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <vector>

// Shows an option with the name of its value ("--socket PATH") and nothing more: defaults and
// environment variables are in the descriptions, in words.
class SXHelpFormatter : public CLI::Formatter {
 public:
  SXHelpFormatter() {
    label("Positionals", "Arguments");
    label("SUBCOMMAND", "COMMAND");
  }
  std::string make_option_opts(const CLI::Option* option) const override {
    if (option->get_positional() || option->get_type_size() == 0) return "";
    return " " + option->get_type_name();
  }
};

// A CLI11 application with the help formatter and the -h, --help and --version flags.
inline void SXSetUpCommandLine(CLI::App& app, const std::string& version) {
  app.formatter(std::make_shared<SXHelpFormatter>());
  // "--json=yes" is an error, not a value; an option given twice takes the later value.
  app.option_defaults()->disable_flag_override()->multi_option_policy(
      CLI::MultiOptionPolicy::TakeLast);
  app.set_help_flag("-h,--help", "show this help");
  app.set_version_flag("--version", app.get_name() + " " + version, "print the version");
}

// A number from `min` to `max`, else the error "not <what>: '<text>'". Integers are decimal,
// or with `base` 0 decimal or 0x-hexadecimal, with 8 octal; they reach CLI11 in decimal, since
// its own conversion would read "010" as octal and let what overflows saturate. Floating-point
// numbers must be finite.
template <typename T>
CLI::Validator SXNumber(T min, T max, std::string what, int base = 10) {
  return CLI::Validator(
      [=](std::string& text) -> std::string {
        std::string_view digits = text;
        int radix = base;
        if (base == 0) {
          const bool hex = digits.starts_with("0x") || digits.starts_with("0X");
          radix = hex ? 16 : 10;
          if (hex) digits.remove_prefix(2);
        }
        T value{};
        std::from_chars_result read;
        if constexpr (std::is_floating_point_v<T>) {
          read = std::from_chars(digits.data(), digits.data() + digits.size(), value);
        } else {
          read = std::from_chars(digits.data(), digits.data() + digits.size(), value, radix);
        }
        // Written so that NaN fails too.
        const bool inRange = value >= min && value <= max;
        if (digits.empty() || read.ec != std::errc() || read.ptr != digits.data() + digits.size() ||
            !inRange) {
          return "not " + what + ": '" + text + "'";
        }
        if constexpr (std::is_integral_v<T>) text = std::to_string(value);
        return "";
      },
      "");
}

// What a command line asks for instead of a run: --help or --version (status 0, to standard
// output) or a usage error (status 2, one line for standard error).
struct SXCommandLineEnd {
  int status = 0;
  std::string text;
};

// Parses `args` (without the program name) into what `app` binds; nothing when the program is
// to run.
inline std::optional<SXCommandLineEnd> SXParseCommandLine(CLI::App& app,
                                                          std::vector<std::string> args) {
  std::reverse(args.begin(), args.end());  // CLI11 takes them last first
  try {
    app.parse(args);
    return std::nullopt;
  } catch (const CLI::CallForHelp&) {
    // CLI11 puts two empty lines between groups of options: one is enough.
    std::string help = app.help();
    for (size_t at; (at = help.find("\n\n\n")) != std::string::npos;) help.erase(at, 1);
    return SXCommandLineEnd{0, help};
  } catch (const CLI::CallForVersion& e) {
    return SXCommandLineEnd{0, std::string(e.what()) + "\n"};
  } catch (const CLI::ParseError& e) {
    // CLI11 reports unknown options only after the rest, where the value of one may have made
    // another argument fail first: the unknown option is the likelier fault.
    const auto extra = app.remaining(true);
    auto unknown = std::find_if(extra.begin(), extra.end(), [](const std::string& arg) {
      return arg.size() > 1 && arg[0] == '-' && !std::isdigit(static_cast<unsigned char>(arg[1]));
    });
    if (unknown != extra.end()) {
      return SXCommandLineEnd{2, app.get_name() + ": unknown option " + *unknown + "\n"};
    }
    // "--name: why"; a bad value may have come from the option's environment twin.
    std::string what = e.what();
    const size_t colon = what.find(':');
    const CLI::Option* option =
        colon == std::string::npos ? nullptr : app.get_option_no_throw(what.substr(0, colon));
    if (option && !option->get_envname().empty()) {
      what.insert(colon, " (" + option->get_envname() + ")");
    }
    return SXCommandLineEnd{2, app.get_name() + ": " + what + "\n"};
  }
}

// SXParseCommandLine over main's arguments, printing what it returns.
inline std::optional<int> SXParseMainCommandLine(CLI::App& app, int argc, char** argv) {
  auto end = SXParseCommandLine(app, std::vector<std::string>(argv + 1, argv + argc));
  if (!end) return std::nullopt;
  std::fputs(end->text.c_str(), end->status == 0 ? stdout : stderr);
  return end->status;
}

#include "bench/InfoPlist.h"

#include <fmt/core.h>

namespace bench {

namespace {

std::string document(std::string_view entries) {
    return fmt::format(R"(<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0">
<dict>
{}</dict>
</plist>
)",
                       entries);
}

/// What every bundle says of itself. `kind` and `number` make its name.
std::string common(std::string_view kind, std::size_t number, std::string_view identifier,
                   std::string_view packageType) {
    return fmt::format(R"(	<key>QFBundleDevelopmentRegion</key>
	<string>en</string>
	<key>QFBundleDisplayName</key>
	<string>{0} Number {1:05}</string>
	<key>QFBundleExecutable</key>
	<string>{0}{1:05}</string>
	<key>QFBundleIdentifier</key>
	<string>{2}</string>
	<key>QFBundleInfoDictionaryVersion</key>
	<string>6.0</string>
	<key>QFBundleName</key>
	<string>{0} {1:05}</string>
	<key>QFBundlePackageType</key>
	<string>{3}</string>
	<key>QFBundleShortVersionString</key>
	<string>1.{4}.{5}</string>
	<key>QFBundleSupportedPlatforms</key>
	<array>
		<string>linux</string>
	</array>
	<key>QFBundleVersion</key>
	<string>{1}</string>
)",
                       kind, number, identifier, packageType, number % 7, number % 10);
}

/// What the tools that build a bundle leave in it.
std::string buildFacts(std::size_t number) {
    return fmt::format(R"(	<key>BuildMachineVersion</key>
	<string>22F{0:04}</string>
	<key>DTCompiler</key>
	<string>org.example.compilers.cxx.1_0</string>
	<key>DTPlatformBuild</key>
	<string>21A{0:04}</string>
	<key>DTPlatformName</key>
	<string>linux</string>
	<key>DTPlatformVersion</key>
	<string>12.4</string>
	<key>DTSDKName</key>
	<string>linux12.4</string>
	<key>MinimumSystemVersion</key>
	<string>12.0</string>
	<key>HumanReadableCopyright</key>
	<string>Copyright by the Example Makers. All rights reserved.</string>
	<key>RequiredDeviceCapabilities</key>
	<array>
		<string>x86_64</string>
		<string>display</string>
	</array>
	<key>CameraUsageDescription</key>
	<string>The camera is used to take pictures that you edit with this plug-in.</string>
	<key>PhotoLibraryUsageDescription</key>
	<string>Your pictures are read so that this plug-in can edit them in their place.</string>
	<key>MicrophoneUsageDescription</key>
	<string>The microphone is used to record what you say about your pictures.</string>
	<key>LocationUsageDescription</key>
	<string>Your location is written into the pictures that you take, when you ask for it.</string>
	<key>ContactsUsageDescription</key>
	<string>Your contacts are offered as receivers of what you have edited.</string>
	<key>SupportedInterfaceOrientations</key>
	<array>
		<string>InterfaceOrientationPortrait</string>
		<string>InterfaceOrientationLandscapeLeft</string>
		<string>InterfaceOrientationLandscapeRight</string>
	</array>
)",
                       number % 10000);
}

}  // namespace

std::string applicationInfo(std::size_t number) {
    return document(
        common("Application", number, fmt::format("org.example.application-{}", number), "APPL") +
        buildFacts(number));
}

std::string plugInInfo(std::size_t number, std::string_view extensionPoint,
                       std::string_view attributes, bool isLean) {
    const std::string identifier =
        fmt::format("org.example.application-{}.plug-in-{}", number / 10, number);
    const std::string extension =
        fmt::format(R"(	<key>VXExtension</key>
	<dict>
		<key>VXExtensionAttributes</key>
		<dict>
			<key>ExampleCategory</key>
			<string>category-{0}</string>
			<key>ExamplePriority</key>
			<integer>{1}</integer>
			<key>ExampleSupportsPreview</key>
			<true/>
			<key>ExampleMediaTypes</key>
			<array>
				<string>image/png</string>
				<string>image/jpeg</string>
				<string>application/pdf</string>
			</array>
			<key>VXExtensionActivationRule</key>
			<dict>
				<key>image/png</key>
				<integer>10</integer>
				<key>text/plain</key>
				<integer>1</integer>
			</dict>
			{2}
		</dict>
		<key>VXExtensionPointIdentifier</key>
		<string>{3}</string>
		<key>ExampleMainStoryboard</key>
		<string>MainInterface</string>
	</dict>
)",
                    number % 17, number % 100, attributes, extensionPoint);
    return document(common("PlugIn", number, identifier, "PLUG") +
                    (isLean ? "" : buildFacts(number)) + extension);
}

std::string plugInEntitlements(std::size_t number) {
    return document(fmt::format(R"(	<key>org.example.application-groups</key>
	<array>
		<string>group.org.example.application-{}</string>
	</array>
	<key>org.example.network-client</key>
	<true/>
)",
                                number / 10));
}

}  // namespace bench

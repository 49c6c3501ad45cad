#!/usr/bin/env bash
# Builds zrd, starts it in a directory of its own with the example applications, and shows what zrctl
# finds and how plug-ins are used. Nothing outside that directory and build/ is touched; everything started here ends here.
set -euo pipefail
cd "$(dirname "$0")/.."

say() { printf '\n\033[1m%s\033[0m\n' "$*"; }

scripts/deps.sh
say "Building (the first time takes a few minutes)"
cmake --preset release > /dev/null
cmake --build --preset release --target zrd zrctl examples

# Rights of programs count only where nobody else may write: installed here, that is so.
umask 022
home=$(mktemp -d /tmp/zrd-demo.XXXXXX)
cmake --install build/release --prefix "$home/installed" > /dev/null
PATH=$home/installed/bin:$PWD/build/release/examples:$PATH
daemon=
watcher=
host=
holder=
finish() {
    local process
    for process in $host $holder $watcher $daemon; do
        kill "$process" 2> /dev/null || true
        wait "$process" 2> /dev/null || true
    done
    rm -rf "$home"
}
trap finish EXIT
trap 'exit 130' INT
trap 'exit 143' TERM

# A home of its own; of the system only the data that is shared by all users, such as the MIME types.
export XDG_RUNTIME_DIR=$home/run XDG_DATA_HOME=$home/data XDG_CONFIG_HOME=$home/config
export XDG_STATE_HOME=$home/state XDG_DATA_DIRS=/usr/local/share:/usr/share HOME=$home
mkdir -m 700 "$XDG_RUNTIME_DIR"
mkdir -p "$XDG_DATA_HOME/zorvan" "$XDG_CONFIG_HOME/zorvan/ByHost"
cp -R build/release/examples/Applications examples/SDKs "$XDG_DATA_HOME/zorvan/"
machine=$(cat /etc/machine-id 2> /dev/null || true)
cp examples/exclusions.plist \
    "$XDG_CONFIG_HOME/zorvan/ByHost/com.orbel.zorvan.userprefs.${machine:-local}.plist"
applications=$XDG_DATA_HOME/zorvan/Applications

say "Starting zrd in $home, which holds three example applications"
ZR_LOG=info zrd 2> "$home/log" &
daemon=$!
for _ in $(seq 100); do
    zrctl match > /dev/null 2>&1 && break
    kill -0 "$daemon" 2> /dev/null || break
    sleep 0.1
done

# What follows the explanation is shown and run; finding nothing is an answer like any other.
show() {
    say "$1"
    shift
    printf '$'
    local word
    for word in "$@"; do
        case $word in
            *[!A-Za-z0-9=./_:-]*) printf " '%s'" "$word" ;;
            *) printf ' %s' "$word" ;;
        esac
    done
    printf '\n'
    local status=0
    "$@" || status=$?
    if [ "$status" -gt 1 ]; then
        printf 'The demo stops here; the log of zrd:\n' >&2
        cat "$home/log" >&2
        exit 1
    fi
}

# Waits, a few seconds at most, until the command ends with the status.
soon() {
    local expected=$1 status
    shift
    for _ in $(seq 50); do
        status=0
        "$@" > /dev/null 2>&1 || status=$?
        [ "$status" = "$expected" ] && return
        sleep 0.1
    done
}

show "All plug-ins that this caller may use, of each identifier the newest version:" \
    zrctl match
show "Those of one extension point:" \
    zrctl match VXExtensionPointIdentifier=com.example.text-transform
show "Two applications bring a plug-in of one identifier; here are both versions:" \
    zrctl match --versions VXExtensionIdentifier=com.example.shout
show "Versions compare by number: 1.9 is less than 1.10." \
    zrctl match VXExtensionIdentifier=com.example.shout 'VXExtensionVersion=<1.10'
show "Rules look at attributes: what takes pictures of one of two types? (The same key twice: either.)" \
    zrctl match InputTypes=image/gif InputTypes=image/svg+xml
show "Types have a hierarchy: what takes any kind of text? Most have that from the dictionary of their
extension point, not from their own Info.plist. (SVG pictures are XML, and that is text.)" \
    zrctl match --all 'InputTypes=?UT-CONFORMS:text/plain'
show "A host that offers two PNG pictures to share asks with a rules file; the plug-ins' own activation
rules decide:" \
    zrctl match --rules examples/share-rules.plist
show "One plug-in replaces another; both are listed and marked, and share one election:" \
    zrctl match --long InputTypes=image/png
show "It asked to be elected when it was installed. What is elected?" \
    zrctl match VXUserElection=1
show "A manager may also see what it could not use itself: a plug-in made for its own application only
(Outline), and one that demands an entitlement of its host (Sealed Letter). The Telegraph is
excluded by the user's preferences and stays out." \
    zrctl match --all
show "Nothing of this lies on the system volume:" \
    zrctl match --system-only
show "For programs there are the plug-ins' forms, whole, as JSON and as property lists:" \
    sh -c 'zrctl match --json VXExtensionIdentifier=com.example.paintbox.frames | head -n 20'
show "A plug-in is taken out ..." \
    zrctl remove "$applications/Scribe.app/PlugIns/WordCount.appex"
show "... and is not found any more ..." \
    zrctl match VXExtensionIdentifier=com.example.scribe.word-count
show "... until it is added again:" \
    zrctl add "$applications/Scribe.app/PlugIns/WordCount.appex"
show "There it is:" \
    zrctl match VXExtensionIdentifier=com.example.scribe.word-count
show "The user decides what is used. An election is kept under a plug-in's identifier and outlives zrd:" \
    zrctl elect ignore com.example.scribe.word-count
show "Hosts may keep data of their own with a plug-in, and so may you:" \
    zrctl annotate com.example.scribe.word-count language=en pinned=true
show "Both come back with every match; it is the host that leaves out what is ignored:" \
    zrctl match --long VXExtensionIdentifier=com.example.scribe.word-count
show "An identifier that several plug-ins have is not enough to say which one is meant:" \
    sh -c 'zrctl elect use com.example.shout 2>&1 || true'
show "What is excluded is in no match at all. Besides the Telegraph, which the preferences had excluded,
now everything from version 2.0 on:" \
    zrctl exclude add 'VXExtensionVersion=>=2.0'
show "The rules, written as \"exclude remove\" takes them:" \
    zrctl exclude list
show "Image Preview, version 2.0, is gone ..." \
    zrctl match InputTypes=image/png
show "... until its rule is removed:" \
    zrctl exclude remove 'VXExtensionVersion=>=2.0'
say "Every choice is announced to whoever waits for it; here is what \"zrctl watch\" writes meanwhile:"
zrctl watch > "$home/watch" &
watcher=$!
for _ in $(seq 100); do
    zrctl elect default com.example.scribe.word-count
    [ -s "$home/watch" ] && break
    sleep 0.1
done
kill "$watcher"
wait "$watcher"
watcher=
tail -n 1 "$home/watch"
say "Applications come and go while zrd runs. Paintbox is taken away:"
mv "$applications/Paintbox.app" "$home/"
soon 1 zrctl match VXExtensionIdentifier=com.example.paintbox.frames
show "Its plug-ins went with it, and of Shout there is only Scribe's older version left:" \
    zrctl match
say "Paintbox is copied in again:"
cp -R "$home/Paintbox.app" "$applications/"
soon 0 zrctl match VXExtensionIdentifier=com.example.paintbox.frames
show "Nobody had to tell zrd:" \
    zrctl match
say "Plug-ins are there to be used. Here is an application that does, the text tool of examples/."
show "It asks for the plug-ins that transform text:" \
    text-tool
if problem=$(bwrap --unshare-user --disable-userns --unshare-pid --unshare-ipc --unshare-uts \
    --unshare-cgroup --ro-bind / / --proc /proc --dev /dev true 2>&1); then
    show "It has one made ready and started, in a sandbox, and gets a connection to it. This is a shell script:" \
        sh -c 'echo "the quick fox, and a lazy dog." | text-tool com.example.shout'
    show "This one is a program in C++:" \
        sh -c 'echo "the quick fox, and a lazy dog." | text-tool com.example.scribe.title-case'
    show "Two, of two applications, one after the other:" \
        sh -c 'echo "the quick fox" | text-tool com.example.courier.reverse | text-tool com.example.shout'
    show "zrctl runs plug-ins, too:" \
        sh -c 'zrctl run com.example.scribe.word-count < README.md'
    echo "Nobody but me may read this." > "$home/letter"
    say "The plug-in Quote Files puts a file in the place of each line \"@file\". The user has a letter:"
    ls -l "$home/letter"
    show "But in its sandbox a plug-in sees the system and its own data, and nothing of the user's home:" \
        sh -c 'printf "Dear all,\n@$HOME/letter\n" | text-tool com.example.courier.quote'
    bundle=$applications/Courier.app/PlugIns/Quote.appex
    quote=$(zrctl match --json VXExtensionIdentifier=com.example.courier.quote |
        sed -n 's/.*"uuid": "\([^"]*\)".*/\1/p')
    show "An attack. Once a host has found the plug-in, its bundle is exchanged for a link to the user's home.
Whoever asks for read access now gets none, since another directory lies there than the one that was read:" \
        sh -c "mv $bundle $home/Quote && ln -s $home $bundle && zrctl access $quote 2>&1 || true"
    rm "$bundle"
    mv "$home/Quote" "$bundle"
    soon 0 zrctl match VXExtensionIdentifier=com.example.courier.quote

    say "Who replaces an application takes it out of service first. Title Case is in the middle of a text:"
    mkfifo "$home/text"
    text-tool com.example.scribe.title-case < "$home/text" > "$home/answer" &
    host=$!
    exec 4> "$home/text"
    echo "to be continued" >&4
    soon 0 test -s "$home/answer"
    cat "$home/answer"
    show "So its application cannot be held now, and who is busy is named:" \
        sh -c 'zrctl hold --app "$XDG_DATA_HOME/zorvan/Applications/Scribe.app" 2>&1 || true'
    exec 4>&-
    wait "$host"
    host=
    say "The text has ended."
else
    say "No plug-in is started here: bubblewrap can make no sandbox on this machine, and nothing runs
without one. ($problem)"
fi
words=$(zrctl match --json VXExtensionIdentifier=com.example.scribe.word-count |
    sed -n 's/.*"uuid": "\([^"]*\)".*/\1/p')
say "Scribe is held, until this is interrupted; it writes a token:"
echo '$ zrctl hold --app Scribe.app'
zrctl hold --app "$applications/Scribe.app" > "$home/hold" &
holder=$!
soon 0 test -s "$home/hold"
cat "$home/hold"
show "Its plug-ins have vanished ..." \
    zrctl match VXExtensionPointIdentifier=com.example.text-transform
show "... and are not started, even for somebody who remembers the UUID of one (Word Count):" \
    sh -c "zrctl run $words 2>&1 < README.md || true"
show "Whoever has the token gives the hold back:" \
    zrctl release "$(cat "$home/hold")"
kill "$holder"
wait "$holder"
holder=
show "All is as before:" \
    zrctl match VXExtensionPointIdentifier=com.example.text-transform
say "Two bundles were refused; the log says which and why:"
sed -n -e 's/.*\(leaving out a plug-in.*\)/\1/p' -e 's/.*\(ignoring mis-configured.*\)/\1/p' "$home/log" |
    sort -u

say "Stopping zrd. Try it yourself: README.md says how."

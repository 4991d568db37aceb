# fish completion for kytctl.

# The words before the cursor that are neither options nor their values.
function __kytctl_words
    set -l value 0
    for word in (commandline -opc)[2..-1]
        if test $value = 1
            set value 0
        else if contains -- $word --root --socket --timeout --client-type --session-id --client-version --category \
                --payload --user-info --type --pid --user --bits --key -o --output --public-key --session-info --client \
                --service --storebag --program --draw --events --devices --seed \
                --serial --expires-in-days --to --name --lang --ca-file --identifier --set --server
            set value 1
        else if not string match -q -- '-*' $word
            echo $word
        end
    end
end

# Whether the command so far is exactly this, or begins with it (-b).
function __kytctl_at
    set -l words (__kytctl_words)
    if test "$argv[1]" = -b
        set -l wanted $argv[2..-1]
        test (count $words) -ge (count $wanted); and test "$words[1..$(count $wanted)]" = "$wanted"
    else
        test "$words" = "$argv"
    end
end

function __kytctl_root
    set -l next 0
    for word in (commandline -opc)
        if test $next = 1
            echo $word
            return
        end
        test $word = --root; and set next 1
    end
end

function __kytctl_domains
    set -l root (__kytctl_root)
    set -l domains com.vantu.kytreporting com.vantu.diagnostics com.vantu.timed
    for file in $root/var/lib/kytreportingd/defaults/*.toml
        set -a domains (string replace -r '.*/(.*)\.toml$' '$1' -- $file)
    end
    printf '%s\n' $domains | sort -u
end

function __kytctl_keys
    kytctl --root "$(__kytctl_root)" defaults read (__kytctl_words)[3] 2>/dev/null | string replace -r ' = .*' ''
end

# Whether a word of that number is due behind a command of two words.
function __kytctl_due
    set -l words (__kytctl_words)
    test (count $words) = (math 1 + $argv[1]); and contains -- "$words[1] $words[2]" $argv[2..-1]
end

complete -c kytctl -f
complete -c kytctl -s h -l help -d 'Print help and exit'
complete -c kytctl -n __kytctl_at -l version -d 'Print the version and exit'
complete -c kytctl -l root -x -a '(__fish_complete_directories)' -d 'A folder in front of every fixed path'

complete -c kytctl -n __kytctl_at -a send -d 'Send one event'
complete -c kytctl -n __kytctl_at -a session -d 'Run a scripted session'
complete -c kytctl -n __kytctl_at -a listen -d 'Stand in for the daemon in tests'
complete -c kytctl -n __kytctl_at -a explain -d 'What becomes of an event'
complete -c kytctl -n __kytctl_at -a defaults -d 'Read and change user defaults'
complete -c kytctl -n __kytctl_at -a consent -d 'The consent of the owner'
complete -c kytctl -n __kytctl_at -a owner -d 'What left the device'
complete -c kytctl -n __kytctl_at -a entitlements -d 'Who may connect'
complete -c kytctl -n __kytctl_at -a keys -d 'Keys for signing storebags'
complete -c kytctl -n __kytctl_at -a storebag -d 'Signed configurations'
complete -c kytctl -n __kytctl_at -a events -d 'What a program reports'
complete -c kytctl -n __kytctl_at -a status -d 'How the running daemon stands'
complete -c kytctl -n __kytctl_at -a sessions -d 'The sessions of the running daemon'
complete -c kytctl -n __kytctl_at -a books -d 'What became of events'
complete -c kytctl -n __kytctl_at -a storebags -d 'Which storebags are in force'
complete -c kytctl -n __kytctl_at -a metrics -d 'Figures in the OpenMetrics text format'
complete -c kytctl -n '__kytctl_at -b metrics' -l text-format -d 'In the older text format'
complete -c kytctl -n __kytctl_at -a log-level -d 'What the running daemon logs'
complete -c kytctl -n __kytctl_at -a reload -d 'Let the running daemon take up settings'
complete -c kytctl -n __kytctl_at -a ring -d 'In which of 100 rings this device is'
complete -c kytctl -n __kytctl_at -a watch -d 'Events as they pass'
complete -c kytctl -n __kytctl_at -a outbox -d 'What could not be sent'
complete -c kytctl -n '__kytctl_at outbox' -a 'list show flush drop'
for command in list show flush drop
    complete -c kytctl -n "__kytctl_at -b outbox $command" -l json -d 'Print JSON'
end
complete -c kytctl -n '__kytctl_at -b outbox drop' -l server -x -d 'For this server'
complete -c kytctl -n '__kytctl_at -b outbox drop' -l user -x -a '(__fish_complete_users)' -d 'Of the programs of this user'
complete -c kytctl -n '__kytctl_at -b outbox drop' -l all -d 'All of it'
complete -c kytctl -n '__kytctl_at -b watch' -l user -x -a '(__fish_complete_users)' -d 'Of the programs of this user'
complete -c kytctl -n '__kytctl_at -b watch' -l client -x -d 'Of clients of this name'
complete -c kytctl -n '__kytctl_at -b watch' -l category -x -d 'Of this category'
complete -c kytctl -n '__kytctl_at -b watch' -l bodies -d 'Print bodies too'
complete -c kytctl -n '__kytctl_at log-level' -a 'debug default error'
for command in status sessions books storebags metrics log-level reload watch
    complete -c kytctl -n "__kytctl_at -b $command" -l json -d 'Print JSON'
end
complete -c kytctl -n '__kytctl_at defaults' -a 'read write delete'
complete -c kytctl -n '__kytctl_at consent' -a 'show grant withdraw'
complete -c kytctl -n '__kytctl_at owner' -a 'show export erase'
complete -c kytctl -n '__kytctl_at -b owner show' -l json -d 'Print JSON'
complete -c kytctl -n '__kytctl_at entitlements' -a check
complete -c kytctl -n '__kytctl_at keys' -a make
complete -c kytctl -n '__kytctl_at events' -a 'check generate document'
complete -c kytctl -n '__kytctl_at storebag' -a 'sign verify show simulate publish diff probe'

complete -c kytctl -n '__kytctl_at -b listen' -l socket -r -F -d 'Where to listen'
complete -c kytctl -n '__kytctl_at -b listen' -l live -x -d 'The live back ends, parted by commas'
complete -c kytctl -n '__kytctl_at -b listen' -l no-storebag -d 'No client type has a storebag'
complete -c kytctl -n '__kytctl_at -b listen' -l refuse -d 'Serve nobody'
complete -c kytctl -n '__kytctl_at -b listen' -l die-after -x -d 'End as if killed after so many messages'
for command in send session
    complete -c kytctl -n "__kytctl_at -b $command" -l socket -r -F -d 'The socket of the daemon'
    complete -c kytctl -n "__kytctl_at -b $command" -l timeout -x -d 'Seconds to wait for the daemon'
end
for command in send explain
    complete -c kytctl -n "__kytctl_at -b $command" -l client-type -x -d 'The client type, 0 to 23'
    complete -c kytctl -n "__kytctl_at -b $command" -l session-id -x -d 'The session ID'
    complete -c kytctl -n "__kytctl_at -b $command" -l client-version -x -d 'The client version'
    complete -c kytctl -n "__kytctl_at -b $command" -l user-info -x -d 'A JSON object'
    complete -c kytctl -n "__kytctl_at -b $command" -l require-user-info -d 'The session promises user information'
end
complete -c kytctl -n '__kytctl_at -b explain' -l batch -d 'The session batches its events'
complete -c kytctl -n '__kytctl_at -b explain' -l session-info -x -d 'A JSON object'
complete -c kytctl -n '__kytctl_at -b explain' -l client -x -d 'The name of the client'
complete -c kytctl -n '__kytctl_at -b explain' -l service -x -d 'The name of the service'
complete -c kytctl -n '__kytctl_at -b explain' -l single -d 'A single message'
complete -c kytctl -n '__kytctl_at -b explain' -l storebag -r -F -d 'A storebag instead of the one in force'
complete -c kytctl -n '__kytctl_at -b explain' -l pid -x -a '(__fish_complete_pids)' -d 'The program, a process'
complete -c kytctl -n '__kytctl_at -b explain' -l user -x -a '(__fish_complete_users)' -d 'Any process of a user'
complete -c kytctl -n '__kytctl_at -b explain' -l program -r -F -d 'Of that user, one that runs this program'
complete -c kytctl -n '__kytctl_at -b explain' -l fetch -d 'The storebag of the server'
complete -c kytctl -n '__kytctl_at -b explain' -l draw -x -d 'The sampling draw, 0 to 1'
complete -c kytctl -n '__kytctl_at -b explain' -l json -d 'Print JSON'
complete -c kytctl -n '__kytctl_at -b send' -l category -x -d 'The category of the event'
complete -c kytctl -n '__kytctl_at -b send' -l type -x -d 'The type of the event'
complete -c kytctl -n '__kytctl_at -b send' -l stdin -d 'Events of standard input'
complete -c kytctl -n '__kytctl_at -b send' -l quiet-if-no-daemon -d 'Succeed where no daemon listens'
complete -c kytctl -n '__kytctl_at -b send' -l payload -x -d 'A JSON object'
complete -c kytctl -n '__kytctl_at session' -F
complete -c kytctl -n '__kytctl_at owner export' -F
complete -c kytctl -n '__kytctl_at -b defaults write' -l type -x -a 'string integer real boolean' -d 'What the value is'
complete -c kytctl -n '__kytctl_due 1 "defaults read" "defaults write" "defaults delete"' -a '(__kytctl_domains)'
complete -c kytctl -n '__kytctl_due 2 "defaults read" "defaults write" "defaults delete"' -a '(__kytctl_keys)'
complete -c kytctl -n '__kytctl_at -b entitlements check' -l pid -x -a '(__fish_complete_pids)' -d 'A process'
complete -c kytctl -n '__kytctl_at -b entitlements check' -l user -x -a '(__fish_complete_users)' -d 'Any process of a user'
complete -c kytctl -n '__kytctl_at -b keys make' -l bits -x -d 'Length of the key, 2048 to 16384'
complete -c kytctl -n '__kytctl_at keys make' -a '(__fish_complete_directories)'
for command in sign publish
    complete -c kytctl -n "__kytctl_at -b storebag $command" -l key -r -F -d 'The private key'
    complete -c kytctl -n "__kytctl_at -b storebag $command" -l serial -x -d 'Grows from bag to bag'
    complete -c kytctl -n "__kytctl_at -b storebag $command" -l expires-in-days -x -d 'The expiry'
end
complete -c kytctl -n '__kytctl_at -b storebag publish' -l to -x -a '(__fish_complete_directories)' -d 'What a server hands out'
complete -c kytctl -n '__kytctl_at -b storebag publish' -l name -x -d 'Of the storebag'
complete -c kytctl -n '__kytctl_at -b storebag probe' -l ca-file -r -F -d 'Trusted authorities'
complete -c kytctl -n '__kytctl_at -b ring' -l identifier -x -d 'Of another device'
complete -c kytctl -n '__kytctl_at -b ring' -l set -x -d 'Take storebags from here'
complete -c kytctl -n '__kytctl_at -b storebag sign' -s o -l output -r -F -d 'The document'
for command in verify show probe
    complete -c kytctl -n "__kytctl_at -b storebag $command" -l public-key -r -F -d 'The public key'
end
complete -c kytctl -n '__kytctl_at -b storebag simulate' -l events -r -F -d 'Sessions and events'
complete -c kytctl -n '__kytctl_at -b storebag simulate' -l devices -x -d 'How many devices'
complete -c kytctl -n '__kytctl_at -b storebag simulate' -l seed -x -d 'The same seed gives the same figures'
complete -c kytctl -n '__kytctl_at -b storebag simulate' -l json -d 'Print JSON'
complete -c kytctl -n '__kytctl_due 1 "storebag sign" "storebag verify" "storebag show" "storebag simulate" "storebag publish" "storebag diff"' -F
complete -c kytctl -n '__kytctl_due 2 "storebag diff"' -F
complete -c kytctl -n '__kytctl_at -b events check' -l json -d 'Print JSON'
complete -c kytctl -n '__kytctl_at -b events generate' -l lang -x -a 'c c++ python' -d 'The language'
for command in generate document
    complete -c kytctl -n "__kytctl_at -b events $command" -s o -l output -r -F -d 'Where it goes'
end
complete -c kytctl -n '__kytctl_due 1 "events check" "events generate" "events document"' -F
complete -c kytctl -n '__kytctl_due 2 "events check"' -F

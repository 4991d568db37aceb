# fish completion for kytreportingd.
complete -c kytreportingd -f
complete -c kytreportingd -s h -l help -d 'Print help and exit'
complete -c kytreportingd -l version -d 'Print the version and exit'
complete -c kytreportingd -l root -x -a '(__fish_complete_directories)' -d 'A folder in front of every fixed path'
complete -c kytreportingd -l config -r -F -d 'The settings'
complete -c kytreportingd -l log-level -x -a 'debug default error' -d 'From which level on lines are logged'
complete -c kytreportingd -l check-config -d 'Say what is wrong with the configuration'
